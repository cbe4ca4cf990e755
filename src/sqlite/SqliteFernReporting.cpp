#include "sqlite/SqliteFernReporting.h"

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <span>

#include "common/SXThreadSafety.h"
#include "common/SXValueText.h"
#include "linux/CompletionThread.h"
#include "platform/DiscardLog.h"

namespace {

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS sessions(id INTEGER PRIMARY KEY, time REAL, "
    "session_info_json TEXT, user_info_json TEXT, token TEXT);"
    "CREATE TABLE IF NOT EXISTS messages(id INTEGER PRIMARY KEY, time REAL, session_id INTEGER, "
    "session_info_json TEXT, user_info_json TEXT, category INTEGER, type INTEGER, "
    "payload_json TEXT);"
    "CREATE TABLE IF NOT EXISTS flushes(id INTEGER PRIMARY KEY, time REAL, session_id INTEGER);"
    // Each session's newest message, so that retention can tell which sessions messages still
    // refer to. One row per session and commit costs less than an index entry per message.
    "CREATE TABLE IF NOT EXISTS session_refs(session_id INTEGER PRIMARY KEY, "
    "last_message_id INTEGER);"
    "DROP INDEX IF EXISTS messages_time;"
    "DROP INDEX IF EXISTS sessions_time;"
    "DROP INDEX IF EXISTS flushes_time";

enum Kind { kSessionRow, kMessageRow, kFlushRow, kSessionRefRow, kKinds };

constexpr const char* kInsert[kKinds] = {
    "INSERT INTO sessions(time, session_info_json, user_info_json, token) "
    "VALUES (?1, ?2, ?3, ?4)",
    "INSERT INTO messages(time, session_id, session_info_json, user_info_json, category, type, "
    "payload_json) VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7)",
    "INSERT INTO flushes(time, session_id) VALUES (?1, ?2)",
    // Written right after the session's last message row, whose id last_insert_rowid() holds.
    "INSERT INTO session_refs(session_id, last_message_id) VALUES (?1, last_insert_rowid()) "
    "ON CONFLICT(session_id) DO UPDATE SET last_message_id = excluded.last_message_id",
};

// Stores made before session_refs had an index on messages(session_id) instead.
constexpr const char* kMigrateSessionIndex =
    "BEGIN IMMEDIATE;"
    "INSERT OR IGNORE INTO session_refs(session_id, last_message_id) "
    "SELECT session_id, MAX(id) FROM messages WHERE session_id IS NOT NULL GROUP BY session_id;"
    "DROP INDEX messages_session;"
    "COMMIT";

std::string Json(const SXValue& value) {
  return value.dump(-1, ' ', false, SXValue::error_handler_t::replace);
}

const std::vector<std::string> kDefaultBackends = {"spool"};

}  // namespace

// The connection, its statements and the completion thread, shared by the adapter and the
// sessions it opened.
//
// Rows are group-committed: a caller queues its row and either waits while another caller
// commits, or becomes that committer itself and writes everything queued so far (its own row
// and those of other sessions' threads) in one transaction. Each caller returns only once the
// transaction holding its row has committed or failed.
class SXSqliteFernReporting::Spool {
 public:
  Spool(std::string path, std::vector<std::string> backends, std::shared_ptr<SXLogFacility> log,
        std::chrono::milliseconds busyTimeout)
      : path_(std::move(path)),
        backends_(std::move(backends)),
        log_(std::move(log)),
        busyTimeout_(busyTimeout),
        completions_("sxr-fernreport", log_) {}

  // Stores one row; sets `rowId` to its id.
  SXStatus insert(Kind kind, const SXSqliteRow& row, int64_t* rowId = nullptr) {
    PendingRow mine{kind, &row, rowId, {}, false};
    PendingRow* rows[] = {&mine};
    insertAll(rows);
    return mine.result;
  }

  // Stores session `sessionId`'s message `rows` in order, in one transaction with the session's
  // reference; returns each row's outcome.
  std::vector<SXStatus> insertMessages(int64_t sessionId, const std::vector<SXSqliteRow>& rows) {
    const SXSqliteRow ref = {sessionId};
    std::vector<PendingRow> mine;
    mine.reserve(rows.size() + 1);
    for (const SXSqliteRow& row : rows) mine.push_back({kMessageRow, &row, nullptr, {}, false});
    if (!rows.empty()) mine.push_back({kSessionRefRow, &ref, nullptr, {}, false});
    std::vector<PendingRow*> pointers;
    for (PendingRow& pending : mine) pointers.push_back(&pending);
    insertAll(pointers);
    std::vector<SXStatus> results;
    for (size_t i = 0; i < rows.size(); ++i) results.push_back(std::move(mine[i].result));
    return results;
  }

  // Copies the WAL into the database; SQLite syncs the WAL before it does.
  SXStatus checkpoint() {
    Exclusive exclusive(*this);
    if (SXStatus opened = ensureOpen(); !opened.ok()) return opened;
    if (SXStatus failed = db_->exec("PRAGMA wal_checkpoint(PASSIVE)"); !failed.ok()) {
      return SXFailure(path_ + ": " + failed.error());
    }
    return {};
  }

  void post(std::function<void()> task) { completions_.post(std::move(task)); }
  std::vector<std::string> backends() const {
    SXMutexLock lock(backendsMutex_);
    return backends_;
  }
  void setBackends(std::vector<std::string> backends) {
    SXMutexLock lock(backendsMutex_);
    backends_ = std::move(backends);
  }
  uint64_t writeErrors() const { return writeErrors_.load(); }
  const std::shared_ptr<SXLogFacility>& log() const { return log_; }

  // REQUIRES: the connection is ours (busy_ set by us), or no other thread knows this spool.
  SXStatus ensureOpen() {
    if (db_) return {};
    std::string recovered;
    auto connection = SXSqliteConnection::openOrRecover(path_, busyTimeout_, kSchema, recovered);
    if (!recovered.empty()) SXLOG(*log_, nullptr, SXLogLevel::kError, "%s", recovered);
    if (!connection.ok()) return connection.status();
    db_ = std::move(*connection);
    SXResult<int64_t> oldIndex = db_->queryInt(
        "SELECT COUNT(*) FROM sqlite_master WHERE type = 'index' AND name = 'messages_session'",
        {});
    SXStatus migrated = oldIndex.status();
    if (migrated.ok() && *oldIndex != 0) migrated = db_->exec(kMigrateSessionIndex);
    if (!migrated.ok()) {
      (void)db_->exec("ROLLBACK");
      close();
      return SXFailure(path_ + ": " + migrated.error());
    }
    SXStatus prepared;
    for (int kind = 0; kind < kKinds && prepared.ok(); ++kind) {
      prepared = db_->prepare(kInsert[kind], insert_[kind]);
    }
    if (prepared.ok()) {
      prepared = db_->prepare(SXSqliteInsertOfRows(kInsert[kMessageRow], kSXSqliteRowsPerInsert),
                              insertMessageBlock_);
    }
    if (!prepared.ok()) {
      close();
      return SXFailure(path_ + ": " + prepared.error());
    }
    return {};
  }

 private:
  // One caller's row, on that caller's stack while it waits.
  struct PendingRow {
    Kind kind;
    const SXSqliteRow* row;
    int64_t* rowId;
    SXStatus result;    // written by the committer before `done`
    bool done = false;  // under the spool's mutex_
  };

  // Holds the connection for one caller that is not committing rows.
  class Exclusive {
   public:
    explicit Exclusive(Spool& spool) : spool_(spool) {
      SXMutexLock lock(spool_.mutex_);
      lock.wait(spool_.idle_, [&]() SX_REQUIRES(spool_.mutex_) { return !spool_.busy_; });
      spool_.busy_ = true;
    }
    ~Exclusive() {
      {
        SXMutexLock lock(spool_.mutex_);
        spool_.busy_ = false;
      }
      spool_.idle_.notify_all();
    }

   private:
    Spool& spool_;
  };

  // Queues `mine` together, then waits while another caller commits them, or commits
  // everything queued so far itself. Returns once every row of `mine` is done.
  void insertAll(std::span<PendingRow* const> mine) {
    if (mine.empty()) return;
    SXMutexLock lock(mutex_);
    queued_.insert(queued_.end(), mine.begin(), mine.end());
    // Rows queued in one go are taken by one committer, so the last tells of all of them.
    PendingRow& last = *mine.back();
    lock.wait(idle_, [&]() SX_REQUIRES(mutex_) { return last.done || !busy_; });
    if (last.done) return;
    busy_ = true;
    std::vector<PendingRow*> batch;
    batch.swap(queued_);
    lock.unlock();
    commitBatch(batch);
    lock.lock();
    for (PendingRow* pending : batch) pending->done = true;
    busy_ = false;
    lock.unlock();
    idle_.notify_all();
  }

  // REQUIRES: busy_ set by this thread. Writes `batch` in one transaction; every row gets the
  // transaction's outcome.
  void commitBatch(const std::vector<PendingRow*>& batch) {
    SXStatus failed = ensureOpen();
    if (failed.ok()) {
      failed = writeRows(batch);
      if (!failed.ok()) {
        if (batch.size() > 1) (void)db_->exec("ROLLBACK");
        close();  // the next batch starts on a fresh connection
        failed = SXFailure(path_ + ": " + failed.error());
      }
    }
    if (!failed.ok()) writeErrors_ += batch.size();
    for (PendingRow* pending : batch) pending->result = failed;
  }

  // REQUIRES: busy_ set by this thread and the connection open.
  SXStatus writeRows(const std::vector<PendingRow*>& batch) {
    if (batch.size() == 1) return writeRow(*batch.front());  // its own transaction
    if (SXStatus failed = db_->exec("BEGIN IMMEDIATE"); !failed.ok()) return failed;
    for (size_t i = 0; i < batch.size();) {
      bool block = startsMessageBlock(batch, i);
      SXStatus written = block ? writeMessageBlock(batch, i) : writeRow(*batch[i]);
      if (!written.ok()) return written;
      i += block ? kSXSqliteRowsPerInsert : 1;
    }
    return db_->exec("COMMIT");
  }

  // Whether kSXSqliteRowsPerInsert message rows, none of which wants its id, start at `at`.
  static bool startsMessageBlock(const std::vector<PendingRow*>& batch, size_t at) {
    if (batch.size() - at < kSXSqliteRowsPerInsert) return false;
    return std::all_of(
        batch.begin() + static_cast<ptrdiff_t>(at),
        batch.begin() + static_cast<ptrdiff_t>(at + kSXSqliteRowsPerInsert),
        [](const PendingRow* row) { return row->kind == kMessageRow && !row->rowId; });
  }

  SXStatus writeMessageBlock(const std::vector<PendingRow*>& batch, size_t at) {
    const SXSqliteRow* rows[kSXSqliteRowsPerInsert];
    for (size_t k = 0; k < kSXSqliteRowsPerInsert; ++k) rows[k] = batch[at + k]->row;
    return insertMessageBlock_.run(rows);
  }

  SXStatus writeRow(PendingRow& pending) {
    if (SXStatus failed = insert_[pending.kind].run(*pending.row); !failed.ok()) return failed;
    if (pending.rowId) *pending.rowId = db_->lastInsertRowId();
    return {};
  }

  // REQUIRES: busy_ set by this thread. Statements go before the connection they belong to.
  void close() {
    for (auto& statement : insert_) statement = SXSqliteStatement();
    insertMessageBlock_ = SXSqliteStatement();
    db_.reset();
  }

  const std::string path_;
  mutable SXMutex backendsMutex_;
  std::vector<std::string> backends_ SX_GUARDED_BY(backendsMutex_);
  const std::shared_ptr<SXLogFacility> log_;
  const std::chrono::milliseconds busyTimeout_;
  SXMutex mutex_;
  std::condition_variable idle_;                           // busy_ cleared or rows done
  std::vector<PendingRow*> queued_ SX_GUARDED_BY(mutex_);  // rows waiting for a transaction
  bool busy_ SX_GUARDED_BY(mutex_) = false;                // a thread owns the connection
  // Owned by the thread that set busy_ (or the constructor, before the spool is shared).
  std::unique_ptr<SXSqliteConnection> db_;
  SXSqliteStatement insert_[kKinds];
  SXSqliteStatement insertMessageBlock_;  // kSXSqliteRowsPerInsert message rows at once
  std::atomic<uint64_t> writeErrors_{0};  // rows not stored; any thread reads
  SXCompletionThread completions_;        // declared last: joined before the rest goes
};

class SXSqliteFernReporting::Session final : public FernReportingSession {
 public:
  Session(std::shared_ptr<Spool> spool, int64_t id, std::string serviceName)
      : spool_(std::move(spool)), id_(id), serviceName_(std::move(serviceName)) {}

  std::string description() const override {
    return "<FernReportingSession " + std::to_string(id_) + " service=" + serviceName_ + ">";
  }

  void startConfiguration(FernBackendsCompletion completion) override {
    if (!completion) return;
    spool_->post([backends = spool_->backends(), completion = std::move(completion)] {
      if (backends.empty()) {
        completion(std::nullopt);
      } else {
        completion(backends);
      }
    });
  }

  bool sendMessage(uint16_t category, uint16_t type, const SXValue& payload,
                   std::optional<FernError>& error) override {
    FernSendOutcome outcome =
        std::move(sendMessages({{category, type, &payload, nullptr}}).front());
    error = std::move(outcome.error);
    return outcome.sent;
  }

  std::vector<FernSendOutcome> sendMessages(const std::vector<FernMessage>& messages) override {
    std::vector<SXSqliteRow> rows;
    rows.reserve(messages.size());
    SXSqliteField time = SXSqliteNow();
    for (const FernMessage& message : messages) {
      rows.push_back({time, id_, nullptr, nullptr, int64_t(message.category), int64_t(message.type),
                      message.payloadJson ? SXSqliteField(message.payloadJson)
                                          : SXSqliteField(Json(*message.payload))});
    }
    auto results = spool_->insertMessages(id_, rows);
    std::vector<FernSendOutcome> outcomes(messages.size());
    for (size_t i = 0; i < results.size(); ++i) {
      outcomes[i].sent = results[i].ok();
      if (!results[i].ok()) {
        outcomes[i].error = FernError{"cannot store the message: " + results[i].error()};
      }
    }
    return outcomes;
  }

  void flushMessages(FernFlushCompletion completion) override {
    // The flush row is stored now, so that it follows exactly the messages sent before it.
    SXStatus failed = spool_->insert(kFlushRow, {SXSqliteNow(), id_});
    spool_->post([spool = spool_, failed, completion = std::move(completion)]() mutable {
      if (failed.ok()) failed = spool->checkpoint();
      if (!completion) return;
      if (!failed.ok()) {
        completion(FernError{"cannot flush the messages: " + failed.error()});
      } else {
        completion(std::nullopt);
      }
    });
  }

 private:
  const std::shared_ptr<Spool> spool_;
  const int64_t id_;
  const std::string serviceName_;
};

SXSqliteFernReporting::SXSqliteFernReporting(std::string dbPath, std::string configPath,
                                             std::shared_ptr<SXLogFacility> log,
                                             std::chrono::milliseconds busyTimeout)
    : configPath_(std::move(configPath)) {
  log = SXLogOrDiscard(std::move(log));
  std::vector<std::string> backends = loadBackends(configPath_, log.get());
  spool_ = std::make_shared<Spool>(std::move(dbPath), std::move(backends), log, busyTimeout);
  if (SXStatus opened = spool_->ensureOpen(); !opened.ok()) {
    SXLOG(*log, nullptr, SXLogLevel::kError, "%s", opened.error());
  }
}

SXSqliteFernReporting::~SXSqliteFernReporting() = default;

std::vector<std::string> SXSqliteFernReporting::backends() const { return spool_->backends(); }

bool SXSqliteFernReporting::reloadBackends() {
  auto backends = loadBackends(configPath_, spool_->log().get());
  if (backends == spool_->backends()) return false;
  spool_->setBackends(std::move(backends));
  return true;
}

uint64_t SXSqliteFernReporting::writeErrors() const { return spool_->writeErrors(); }

std::shared_ptr<FernSecureHierarchyToken> SXSqliteFernReporting::newHierarchyToken(
    const std::shared_ptr<FernSecureHierarchyToken>& parent) {
  // The process id and its start time tell processes apart; the counter tells tokens apart.
  static const uint64_t startTime = static_cast<uint64_t>(
      std::chrono::system_clock::now().time_since_epoch() / std::chrono::microseconds(1));
  static std::atomic<uint64_t> counter{0};
  std::string identifier =
      SXFormat("%d-%llx-%llu", static_cast<int>(::getpid()), startTime, counter.fetch_add(1) + 1);
  if (parent) identifier = parent->identifier() + "/" + identifier;
  return std::make_shared<FernSecureHierarchyToken>(std::move(identifier));
}

std::shared_ptr<FernReportingSession> SXSqliteFernReporting::openSession(const SXValue& sessionInfo,
                                                                         const SXValue& userInfo,
                                                                         const SXValue&) {
  SXSqliteField token = nullptr;
  if (sessionInfo.is_object()) {
    auto it = sessionInfo.find(fern::kSessionInfoHierarchyToken);
    if (it != sessionInfo.end() && it->is_string()) token = it->get<std::string>();
  }
  int64_t id = 0;
  SXStatus failed =
      spool_->insert(kSessionRow, {SXSqliteNow(), Json(sessionInfo), Json(userInfo), token}, &id);
  if (!failed.ok()) {
    SXLOG(*spool_->log(), nullptr, SXLogLevel::kError, "cannot store the session: %s",
          failed.error());
    return nullptr;
  }
  std::string serviceName = "(null)";
  if (userInfo.is_object() && userInfo.contains(fern::kUserInfoServiceName)) {
    serviceName = SXValueText(userInfo[fern::kUserInfoServiceName]);
  }
  return std::make_shared<Session>(spool_, id, std::move(serviceName));
}

bool SXSqliteFernReporting::sendOneMessage(const SXValue& sessionInfo, const SXValue& userInfo,
                                           uint16_t category, uint16_t type, const SXValue& payload,
                                           std::optional<FernError>& error) {
  SXStatus failed =
      spool_->insert(kMessageRow, {SXSqliteNow(), nullptr, Json(sessionInfo), Json(userInfo),
                                   int64_t(category), int64_t(type), Json(payload)});
  if (failed.ok()) return true;
  error = FernError{"cannot store the message: " + failed.error()};
  return false;
}

std::vector<std::string> SXSqliteFernReporting::loadBackends(const std::string& configPath,
                                                             SXLogFacility* log) {
  std::error_code ec;
  if (std::filesystem::status(configPath, ec).type() == std::filesystem::file_type::not_found) {
    return kDefaultBackends;
  }
  auto malformed = [&](const std::string& why) {
    if (log) {
      SXLOG_IN("loadBackends", *log, nullptr, SXLogLevel::kError,
               "%s: %s; using the backends [\"spool\"]", configPath, why);
    }
    return kDefaultBackends;
  };
  std::ifstream in(configPath);
  if (!in) return malformed("cannot be read");
  SXValue config = SXValue::parse(in, nullptr, false);
  if (config.is_discarded()) return malformed("not valid JSON");
  if (!config.is_object()) return malformed("not a JSON object");
  auto it = config.find("backends");
  if (it == config.end()) return kDefaultBackends;
  if (!it->is_array()) return malformed("\"backends\" is not a list");
  std::vector<std::string> backends;
  for (const SXValue& backend : *it) {
    if (!backend.is_string()) return malformed("\"backends\" holds something other than names");
    backends.push_back(backend.get<std::string>());
  }
  return backends;
}
