// Production analytics events: every accepted event becomes one row of the table
// `events(id INTEGER PRIMARY KEY, time REAL, name TEXT, payload_json TEXT)` in a SQLite file
// (`<state-dir>/tallyvane.db`). `time` is seconds since the Unix epoch at the moment the event
// was offered; `payload_json` is the provider's value as compact JSON (invalid UTF-8 replaced).
//
// sendEventLazy() may be called from any thread and does not wait on the disk: it queues the
// event and returns true. A writer thread calls the payload provider and commits queued events
// in batches. On failure (the store cannot be opened, a write fails) one error line goes to
// the default log of `log` and that batch is lost; later events are written as usual. While
// 100,000 events already wait, sendEventLazy() waits for room: a burst faster than the disk
// slows its senders down (through the server queue and then the connections' back-pressure)
// instead of losing events.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/Tallyvane.h"
#include "sqlite/SqliteBatchWriter.h"

class SXSqliteTallyvane final : public SXTallyvane {
 public:
  // A store that cannot be opened logs an error line; its events are then dropped like those
  // of a failing write until the store can be opened.
  SXSqliteTallyvane(std::string dbPath, std::shared_ptr<SXLogFacility> log,
                    std::chrono::milliseconds busyTimeout = kSXSqliteBusyTimeout);
  // Writes every event still queued, then stops the writer thread.
  ~SXSqliteTallyvane() override = default;

  bool sendEventLazy(const std::string& name, SXPayloadProvider provider) override;
  // Stores the text `json` returns; `provider` is not called.
  bool sendEventLazy(const std::string& name, SXPayloadProvider provider,
                     SXPayloadTextProvider json) override;

  // Returns once every event offered before the call is committed (or dropped on failure).
  // Not from a payload provider.
  void flush();

  // Events that could not be stored since start (the store failed to open or to commit).
  uint64_t writeErrors() const { return writer_.writeErrors(); }

  // The last `limit` events (all when `limit` <= 0) whose name matches the GLOB pattern
  // `nameFilter` (an exact name matches itself) and, with `since`, stored at or after that
  // time (seconds since the epoch), oldest first, as objects {"id", "time", "name",
  // "payload"}; "payload" is the stored JSON parsed (its text when it does not parse).
  // Opens `dbPath` read-only.
  static SXResult<std::vector<SXValue>> readEvents(const std::string& dbPath,
                                                   std::optional<std::string> nameFilter,
                                                   int64_t limit, std::optional<double> since);
  // The same, for callers that treat an unreadable store as an empty one.
  static std::vector<SXValue> readEvents(const std::string& dbPath,
                                         std::optional<std::string> nameFilter, int64_t limit);

 private:
  SXSqliteBatchWriter writer_;
};
