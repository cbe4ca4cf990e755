// Production power log: every entry becomes one row of the table `entries(id INTEGER PRIMARY
// KEY, time REAL, client_id INTEGER, event TEXT, payload_json TEXT)` in a SQLite file
// (`<state-dir>/joulebook.db`). `time` is seconds since the Unix epoch when the entry was
// logged; `payload_json` is the entry as compact JSON (invalid UTF-8 replaced). Filters are
// not stored: nothing here reads the log back by filter.
//
// logRegisteredEvent() may be called from any thread and does not wait on the disk: a writer
// thread commits queued entries in batches. On failure (the store cannot be opened, a write
// fails) one error line goes to the default log of `log` and that batch is lost; later entries
// are written as usual. While 100,000 entries already wait, a new one waits for room.
#pragma once

#include <memory>
#include <string>

#include "platform/Joulebook.h"
#include "platform/Log.h"
#include "sqlite/SqliteBatchWriter.h"

class SXSqliteJoulebook final : public SXJoulebook {
 public:
  // A store that cannot be opened logs an error line; its entries are then dropped like those
  // of a failing write until the store can be opened.
  SXSqliteJoulebook(std::string dbPath, std::shared_ptr<SXLogFacility> log,
                    std::chrono::milliseconds busyTimeout = kSXSqliteBusyTimeout);
  // Writes every entry still queued, then stops the writer thread.
  ~SXSqliteJoulebook() override = default;

  void logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                          const std::optional<SXValue>& filter) override;

  // Returns once every entry logged before the call is committed (or dropped on failure).
  void flush();

  // Entries that could not be stored since start (the store failed to open or to commit).
  uint64_t writeErrors() const { return writer_.writeErrors(); }

 private:
  SXSqliteBatchWriter writer_;
};
