#include "platform/OtlpSpoolReader.h"

namespace {

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS otlp_export(id INTEGER PRIMARY KEY CHECK(id = 1), "
    "last_message_id INTEGER NOT NULL)";

// A session message takes its session's info from the sessions row; a standalone message
// carries its own.
constexpr const char* kSelectBatch =
    "SELECT m.id AS id, m.time AS time, m.session_id AS session_id, m.category AS category, "
    "m.type AS type, m.payload_json AS payload_json, "
    "COALESCE(m.session_info_json, s.session_info_json) AS session_info_json, "
    "COALESCE(m.user_info_json, s.user_info_json) AS user_info_json, s.token AS token "
    "FROM messages m LEFT JOIN sessions s ON s.id = m.session_id "
    "WHERE m.id > ?1 AND m.id <= ?2 ORDER BY m.id";
// Sizes first, so that a batch is cut to size before its payloads are loaded.
constexpr const char* kSelectSizes =
    "SELECT id, LENGTH(CAST(payload_json AS BLOB)) AS bytes FROM messages WHERE id > ?1 "
    "ORDER BY id LIMIT ?2";
constexpr const char* kSelectCursor = "SELECT last_message_id FROM otlp_export WHERE id = 1";
constexpr const char* kStoreCursor =
    "INSERT INTO otlp_export(id, last_message_id) VALUES (1, ?1) "
    "ON CONFLICT(id) DO UPDATE SET last_message_id = excluded.last_message_id";
constexpr const char* kCountBeyond = "SELECT COUNT(*) AS n FROM messages WHERE id > ?1";

// The id of the last of `sizes` (rows of id and bytes) that fit in `maxBytes`, one at least.
int64_t LastThatFits(const std::vector<SXValue>& sizes, size_t maxBytes) {
  int64_t last = 0;
  size_t total = 0;
  for (const SXValue& row : sizes) {
    size_t bytes = row["bytes"].is_number_integer() ? row["bytes"].get<size_t>() : 0;
    if (last != 0 && total + bytes > maxBytes) break;
    total += bytes;
    last = row["id"].get<int64_t>();
  }
  return last;
}

}  // namespace

struct SXOtlpSpoolReader::Db {
  // Statements go before the connection they belong to.
  std::unique_ptr<SXSqliteConnection> connection;
  SXSqliteStatement selectSizes, selectBatch, selectCursor, storeCursor, countBeyond;
};

SXOtlpSpoolReader::SXOtlpSpoolReader(std::string dbPath, std::chrono::milliseconds busyTimeout)
    : path_(std::move(dbPath)), busyTimeout_(busyTimeout) {}

SXOtlpSpoolReader::~SXOtlpSpoolReader() = default;

std::optional<std::string> SXOtlpSpoolReader::fail(const std::string& what) {
  db_.reset();  // the next call starts on a fresh connection
  return path_ + ": " + what;
}

std::optional<std::string> SXOtlpSpoolReader::ensureOpen() {
  if (db_) return std::nullopt;
  std::string error;
  auto connection = SXSqliteConnection::open(path_, SXSqliteConnection::Mode::kReadWrite,
                                             busyTimeout_, kSchema, error);
  if (!connection) return error;
  db_ = std::make_unique<Db>();
  db_->connection = std::move(connection);
  std::pair<const char*, SXSqliteStatement*> statements[] = {{kSelectSizes, &db_->selectSizes},
                                                             {kSelectBatch, &db_->selectBatch},
                                                             {kSelectCursor, &db_->selectCursor},
                                                             {kStoreCursor, &db_->storeCursor},
                                                             {kCountBeyond, &db_->countBeyond}};
  for (auto& [sql, statement] : statements) {
    // A spool not yet made by its writer has no messages table: a failure to retry later.
    if (auto failed = db_->connection->prepare(sql, *statement)) return fail(*failed);
  }
  if (cursorLoaded_) return std::nullopt;
  std::vector<SXValue> rows;
  if (auto failed = db_->selectCursor.query({}, rows)) return fail(*failed);
  if (!rows.empty() && rows[0]["last_message_id"].is_number_integer()) {
    cursor_ = rows[0]["last_message_id"].get<int64_t>();
  }
  cursorLoaded_ = true;
  return std::nullopt;
}

std::optional<std::string> SXOtlpSpoolReader::persistCursor() {
  if (!cursorDirty_) return std::nullopt;
  if (auto failed = db_->storeCursor.run({cursor_})) return fail(*failed);
  cursorDirty_ = false;
  return std::nullopt;
}

std::optional<std::string> SXOtlpSpoolReader::read(size_t limit, size_t maxBytes,
                                                   std::vector<SXValue>& rows) {
  SXMutexLock lock(mutex_);
  if (auto failed = ensureOpen()) return failed;
  if (auto failed = persistCursor()) return failed;
  std::vector<SXValue> sizes;
  if (auto failed = db_->selectSizes.query({cursor_, static_cast<int64_t>(limit)}, sizes)) {
    return fail(*failed);
  }
  if (sizes.empty()) return std::nullopt;
  if (auto failed = db_->selectBatch.query({cursor_, LastThatFits(sizes, maxBytes)}, rows)) {
    return fail(*failed);
  }
  return std::nullopt;
}

std::optional<std::string> SXOtlpSpoolReader::advance(int64_t lastMessageId) {
  SXMutexLock lock(mutex_);
  if (lastMessageId > cursor_) {
    cursor_ = lastMessageId;
    cursorDirty_ = true;
  }
  if (auto failed = ensureOpen()) return failed;
  return persistCursor();
}

int64_t SXOtlpSpoolReader::cursor() const {
  SXMutexLock lock(mutex_);
  return cursor_;
}

uint64_t SXOtlpSpoolReader::backlog() const {
  SXMutexLock lock(mutex_);
  if (!db_) return lastBacklog_;  // opening is left to the exporting thread
  std::vector<SXValue> rows;
  if (!db_->countBeyond.query({cursor_}, rows) && !rows.empty() && rows[0]["n"].is_number()) {
    lastBacklog_ = rows[0]["n"].get<uint64_t>();
  }
  return lastBacklog_;
}
