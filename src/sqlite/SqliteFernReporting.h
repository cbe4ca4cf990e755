// Production server reporting: a durable SQLite spool (`<state-dir>/fernreporting.db`) that
// keeps every session, message and flush for the backends to upload. Tables:
//   sessions(id, time, session_info_json, user_info_json, token): one row per opened session;
//   messages(id, time, session_id, session_info_json, user_info_json, category, type,
//            payload_json): session_id is NULL for single messages, which alone carry their
//            session info and user info (a session's are in its `sessions` row);
//   flushes(id, time, session_id).
// Times are seconds since the Unix epoch; dictionaries are compact JSON (invalid UTF-8
// replaced).
//
// The backends come from the JSON file `configPath` (`{"backends": ["spool"]}`), read at
// construction and by reloadBackends(): an absent file, or one without "backends", means
// ["spool"]; an empty list means no backends; a file that cannot be read or parsed logs an
// error line and means ["spool"]. Every row is stored whatever the backends are; the list is
// what startConfiguration() reports, or nothing (std::nullopt) when it is empty.
//
// All methods may be called from any thread. Completions run on a thread of this adapter,
// never on the caller's, in the order they were asked for. Sends are stored synchronously: a
// send that returns true is committed (WAL, synchronous=NORMAL: it survives a crash of this
// process; a flush checkpoints the WAL, which makes everything before it survive a power loss
// too). Rows that several threads store at once are group-committed: one transaction holds
// them all, and each caller returns once it has committed (a failed transaction fails every
// row in it). On failure a send returns false with a FernError saying why, openSession()
// returns nullptr after an error line on the default log of `log`, and a flush completes with
// an error. A store that cannot be opened is opened again at the next call; a store file that is
// no usable database is moved aside and a new one created, with an error line.
//
// Sessions share the spool: it stays open, and completions keep coming, while any session
// lives, even after this object is gone.
#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "platform/FernReporting.h"
#include "platform/Log.h"
#include "sqlite/SqliteConnection.h"

class SXSqliteFernReporting final : public FernReporting {
 public:
  SXSqliteFernReporting(std::string dbPath, std::string configPath,
                        std::shared_ptr<SXLogFacility> log,
                        std::chrono::milliseconds busyTimeout = kSXSqliteBusyTimeout);
  ~SXSqliteFernReporting() override;

  // Identifiers are "<pid>-<start time in hex>-<counter>", under "<parent>/" when there is a
  // parent; never nullptr.
  std::shared_ptr<FernSecureHierarchyToken> newHierarchyToken(
      const std::shared_ptr<FernSecureHierarchyToken>& parent) override;
  std::shared_ptr<FernReportingSession> openSession(const SXValue& sessionInfo,
                                                    const SXValue& userInfo,
                                                    const SXValue& frameworksToCheck) override;
  bool sendOneMessage(const SXValue& sessionInfo, const SXValue& userInfo, uint16_t category,
                      uint16_t type, const SXValue& payload,
                      std::optional<FernError>& error) override;

  // The configured backends; empty when there are none.
  std::vector<std::string> backends() const;
  // Reads the backends file again; sessions started from now on get the new list. Returns
  // whether it changed.
  bool reloadBackends();

  // Sessions, messages and flushes that could not be stored since start (the store failed to
  // open or the insert failed). Any thread.
  uint64_t writeErrors() const;

  // Reads the backends file as described above.
  static std::vector<std::string> loadBackends(const std::string& configPath, SXLogFacility* log);

 private:
  class Spool;
  class Session;
  const std::string configPath_;
  std::shared_ptr<Spool> spool_;
};
