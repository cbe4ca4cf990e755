#include "platform/SqliteFernReporting.h"

#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <mutex>

#include "common/SXValueText.h"
#include "platform/CompletionThread.h"
#include "platform/DiscardLog.h"

namespace {

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS sessions(id INTEGER PRIMARY KEY, time REAL, "
    "session_info_json TEXT, user_info_json TEXT, token TEXT);"
    "CREATE TABLE IF NOT EXISTS messages(id INTEGER PRIMARY KEY, time REAL, session_id INTEGER, "
    "session_info_json TEXT, user_info_json TEXT, category INTEGER, type INTEGER, "
    "payload_json TEXT);"
    "CREATE TABLE IF NOT EXISTS flushes(id INTEGER PRIMARY KEY, time REAL, session_id INTEGER)";

enum Kind { kSessionRow, kMessageRow, kFlushRow, kKinds };

constexpr const char* kInsert[kKinds] = {
    "INSERT INTO sessions(time, session_info_json, user_info_json, token) "
    "VALUES (?1, ?2, ?3, ?4)",
    "INSERT INTO messages(time, session_id, session_info_json, user_info_json, category, type, "
    "payload_json) VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7)",
    "INSERT INTO flushes(time, session_id) VALUES (?1, ?2)",
};

std::string Json(const SXValue& value) {
  return value.dump(-1, ' ', false, SXValue::error_handler_t::replace);
}

const std::vector<std::string> kDefaultBackends = {"spool"};

}  // namespace

// The connection, its statements and the completion thread, shared by the adapter and the
// sessions it opened.
class SXSqliteFernReporting::Spool {
 public:
  Spool(std::string path, std::vector<std::string> backends, std::shared_ptr<SXLogFacility> log,
        std::chrono::milliseconds busyTimeout)
      : path_(std::move(path)),
        backends_(std::move(backends)),
        log_(std::move(log)),
        busyTimeout_(busyTimeout),
        completions_("sxr-fernreport", log_) {}

  // Stores one row; sets `rowId` to its id. On failure returns why.
  std::optional<std::string> insert(Kind kind, const SXSqliteRow& row, int64_t* rowId = nullptr) {
    std::lock_guard lock(mutex_);
    std::string error;
    if (!ensureOpen(error)) {
      ++writeErrors_;
      return error;
    }
    if (auto failed = insert_[kind].run(row)) {
      ++writeErrors_;
      close();  // the next call starts on a fresh connection
      return path_ + ": " + *failed;
    }
    if (rowId) *rowId = db_->lastInsertRowId();
    return std::nullopt;
  }

  // Copies the WAL into the database; SQLite syncs the WAL before it does.
  std::optional<std::string> checkpoint() {
    std::lock_guard lock(mutex_);
    std::string error;
    if (!ensureOpen(error)) return error;
    if (auto failed = db_->exec("PRAGMA wal_checkpoint(PASSIVE)")) return path_ + ": " + *failed;
    return std::nullopt;
  }

  void post(std::function<void()> task) { completions_.post(std::move(task)); }
  const std::vector<std::string>& backends() const { return backends_; }
  uint64_t writeErrors() const { return writeErrors_.load(); }
  const std::shared_ptr<SXLogFacility>& log() const { return log_; }

  // REQUIRES: mutex_ held, or no other thread knows this spool yet.
  bool ensureOpen(std::string& error) {
    if (db_) return true;
    std::string recovered;
    db_ = SXSqliteConnection::openOrRecover(path_, busyTimeout_, kSchema, error, recovered);
    if (!recovered.empty()) SXLOG(*log_, nullptr, SXLogLevel::kError, "%s", recovered);
    for (int kind = 0; db_ && kind < kKinds; ++kind) {
      if (auto failed = db_->prepare(kInsert[kind], insert_[kind])) {
        error = path_ + ": " + *failed;
        close();
      }
    }
    return db_ != nullptr;
  }

 private:
  // REQUIRES: mutex_ held. Statements go before the connection they belong to.
  void close() {
    for (auto& statement : insert_) statement = SXSqliteStatement();
    db_.reset();
  }

  const std::string path_;
  const std::vector<std::string> backends_;
  const std::shared_ptr<SXLogFacility> log_;
  const std::chrono::milliseconds busyTimeout_;
  std::mutex mutex_;
  std::unique_ptr<SXSqliteConnection> db_;  // guarded by mutex_
  SXSqliteStatement insert_[kKinds];        // guarded by mutex_
  std::atomic<uint64_t> writeErrors_{0};    // rows not stored; any thread reads
  SXCompletionThread completions_;          // declared last: joined before the rest goes
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
    auto failed = spool_->insert(kMessageRow, {SXSqliteNow(), id_, nullptr, nullptr,
                                               int64_t(category), int64_t(type), Json(payload)});
    if (!failed) return true;
    error = FernError{"cannot store the message: " + *failed};
    return false;
  }

  void flushMessages(FernFlushCompletion completion) override {
    // The flush row is stored now, so that it follows exactly the messages sent before it.
    auto failed = spool_->insert(kFlushRow, {SXSqliteNow(), id_});
    spool_->post([spool = spool_, failed, completion = std::move(completion)]() mutable {
      if (!failed) failed = spool->checkpoint();
      if (!completion) return;
      if (failed) {
        completion(FernError{"cannot flush the messages: " + *failed});
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
                                             std::chrono::milliseconds busyTimeout) {
  log = SXLogOrDiscard(std::move(log));
  std::vector<std::string> backends = loadBackends(configPath, log.get());
  spool_ = std::make_shared<Spool>(std::move(dbPath), std::move(backends), log, busyTimeout);
  std::string error;
  if (!spool_->ensureOpen(error)) SXLOG(*log, nullptr, SXLogLevel::kError, "%s", error);
}

SXSqliteFernReporting::~SXSqliteFernReporting() = default;

const std::vector<std::string>& SXSqliteFernReporting::backends() const {
  return spool_->backends();
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
  auto failed =
      spool_->insert(kSessionRow, {SXSqliteNow(), Json(sessionInfo), Json(userInfo), token}, &id);
  if (failed) {
    SXLOG(*spool_->log(), nullptr, SXLogLevel::kError, "cannot store the session: %s", *failed);
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
  auto failed =
      spool_->insert(kMessageRow, {SXSqliteNow(), nullptr, Json(sessionInfo), Json(userInfo),
                                   int64_t(category), int64_t(type), Json(payload)});
  if (!failed) return true;
  error = FernError{"cannot store the message: " + *failed};
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
