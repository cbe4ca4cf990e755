#include "export/OtlpSpoolReader.h"

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

SXStatus SXOtlpSpoolReader::fail(const SXStatus& failed) {
  db_.reset();  // the next call starts on a fresh connection
  return SXFailure(path_ + ": " + failed.error());
}

SXStatus SXOtlpSpoolReader::ensureOpen() {
  if (db_) return {};
  auto connection =
      SXSqliteConnection::open(path_, SXSqliteConnection::Mode::kReadWrite, busyTimeout_, kSchema);
  if (!connection.ok()) return connection.status();
  db_ = std::make_unique<Db>();
  db_->connection = std::move(*connection);
  std::pair<const char*, SXSqliteStatement*> statements[] = {{kSelectSizes, &db_->selectSizes},
                                                             {kSelectBatch, &db_->selectBatch},
                                                             {kSelectCursor, &db_->selectCursor},
                                                             {kStoreCursor, &db_->storeCursor},
                                                             {kCountBeyond, &db_->countBeyond}};
  for (auto& [sql, statement] : statements) {
    // A spool not yet made by its writer has no messages table: a failure to retry later.
    if (SXStatus failed = db_->connection->prepare(sql, *statement); !failed.ok()) {
      return fail(failed);
    }
  }
  if (cursorLoaded_) return {};
  std::vector<SXValue> rows;
  if (SXStatus failed = db_->selectCursor.query({}, rows); !failed.ok()) return fail(failed);
  if (!rows.empty() && rows[0]["last_message_id"].is_number_integer()) {
    cursor_ = rows[0]["last_message_id"].get<int64_t>();
  }
  cursorLoaded_ = true;
  return {};
}

SXStatus SXOtlpSpoolReader::persistCursor() {
  if (!cursorDirty_) return {};
  if (SXStatus failed = db_->storeCursor.run({cursor_}); !failed.ok()) return fail(failed);
  cursorDirty_ = false;
  return {};
}

SXStatus SXOtlpSpoolReader::read(size_t limit, size_t maxBytes, std::vector<SXValue>& rows) {
  SXMutexLock lock(mutex_);
  if (SXStatus failed = ensureOpen(); !failed.ok()) return failed;
  if (SXStatus failed = persistCursor(); !failed.ok()) return failed;
  std::vector<SXValue> sizes;
  if (SXStatus failed = db_->selectSizes.query({cursor_, static_cast<int64_t>(limit)}, sizes);
      !failed.ok()) {
    return fail(failed);
  }
  if (sizes.empty()) return {};
  if (SXStatus failed = db_->selectBatch.query({cursor_, LastThatFits(sizes, maxBytes)}, rows);
      !failed.ok()) {
    return fail(failed);
  }
  return {};
}

SXStatus SXOtlpSpoolReader::advance(int64_t lastMessageId) {
  SXMutexLock lock(mutex_);
  if (lastMessageId > cursor_) {
    cursor_ = lastMessageId;
    cursorDirty_ = true;
  }
  if (SXStatus failed = ensureOpen(); !failed.ok()) return failed;
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
  if (db_->countBeyond.query({cursor_}, rows).ok() && !rows.empty() && rows[0]["n"].is_number()) {
    lastBacklog_ = rows[0]["n"].get<uint64_t>();
  }
  return lastBacklog_;
}
