#include "platform/SqliteConnection.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>

#include "platform/FileSystem.h"

namespace {

std::string Describe(sqlite3* db, const std::string& context) {
  return context + ": " + (db ? sqlite3_errmsg(db) : "out of memory");
}

SXValue ColumnValue(sqlite3_stmt* stmt, int column) {
  switch (sqlite3_column_type(stmt, column)) {
    case SQLITE_INTEGER:
      return static_cast<int64_t>(sqlite3_column_int64(stmt, column));
    case SQLITE_FLOAT:
      return sqlite3_column_double(stmt, column);
    case SQLITE_NULL:
      return nullptr;
    default: {
      const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(stmt, column));
      return std::string(text ? text : "", static_cast<size_t>(sqlite3_column_bytes(stmt, column)));
    }
  }
}

}  // namespace

std::string SXSqliteStatement::failure(const char* context) const {
  std::string sql = stmt_ ? sqlite3_sql(stmt_.get()) : "";
  return Describe(db_, std::string(context) + " \"" + sql.substr(0, sql.find('(')) + "\"");
}

std::optional<std::string> SXSqliteStatement::bind(const SXSqliteRow& params) {
  if (!stmt_) return "statement was never prepared";
  sqlite3_reset(stmt_.get());
  sqlite3_clear_bindings(stmt_.get());
  for (size_t i = 0; i < params.size(); ++i) {
    int index = static_cast<int>(i) + 1;
    int rc = std::visit(
        [&](const auto& v) -> int {
          using T = std::decay_t<decltype(v)>;
          if constexpr (std::is_same_v<T, std::nullptr_t>) {
            return sqlite3_bind_null(stmt_.get(), index);
          } else if constexpr (std::is_same_v<T, int64_t>) {
            return sqlite3_bind_int64(stmt_.get(), index, v);
          } else if constexpr (std::is_same_v<T, double>) {
            return sqlite3_bind_double(stmt_.get(), index, v);
          } else {
            return sqlite3_bind_text64(stmt_.get(), index, v.data(), v.size(), SQLITE_STATIC,
                                       SQLITE_UTF8);
          }
        },
        params[i]);
    if (rc != SQLITE_OK) return failure("bind");
  }
  return std::nullopt;
}

std::optional<std::string> SXSqliteStatement::run(const SXSqliteRow& params) {
  if (auto error = bind(params)) return error;
  int rc;
  while ((rc = sqlite3_step(stmt_.get())) == SQLITE_ROW) {
  }
  std::optional<std::string> error;
  if (rc != SQLITE_DONE) error = failure("step");
  // Resetting releases the statement's read of the database and the bound texts (SQLITE_STATIC).
  sqlite3_reset(stmt_.get());
  sqlite3_clear_bindings(stmt_.get());
  return error;
}

std::optional<std::string> SXSqliteStatement::query(const SXSqliteRow& params,
                                                    std::vector<SXValue>& rows) {
  if (auto error = bind(params)) return error;
  int rc;
  int columns = sqlite3_column_count(stmt_.get());
  while ((rc = sqlite3_step(stmt_.get())) == SQLITE_ROW) {
    SXValue row = SXValue::object();
    for (int c = 0; c < columns; ++c) {
      row[sqlite3_column_name(stmt_.get(), c)] = ColumnValue(stmt_.get(), c);
    }
    rows.push_back(std::move(row));
  }
  std::optional<std::string> error;
  if (rc != SQLITE_DONE) error = failure("step");
  sqlite3_reset(stmt_.get());
  sqlite3_clear_bindings(stmt_.get());
  return error;
}

std::unique_ptr<SXSqliteConnection> SXSqliteConnection::open(const std::string& path, Mode mode,
                                                             std::chrono::milliseconds busyTimeout,
                                                             const std::string& schema,
                                                             std::string& error) {
  int code = SQLITE_OK;
  return openWithCode(path, mode, busyTimeout, schema, error, code);
}

std::unique_ptr<SXSqliteConnection> SXSqliteConnection::openWithCode(
    const std::string& path, Mode mode, std::chrono::milliseconds busyTimeout,
    const std::string& schema, std::string& error, int& code) {
  sqlite3* db = nullptr;
  int flags =
      mode == Mode::kReadOnly ? SQLITE_OPEN_READONLY : SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE;
  // The owner serialises calls, so SQLite's own per-connection mutex is not needed.
  code = sqlite3_open_v2(path.c_str(), &db, flags | SQLITE_OPEN_NOMUTEX, nullptr);
  if (code != SQLITE_OK) {
    error = Describe(db, "cannot open " + path);
    sqlite3_close_v2(db);
    return nullptr;
  }
  auto connection = std::make_unique<SXSqliteConnection>(Key(), db);
  sqlite3_busy_timeout(db, static_cast<int>(busyTimeout.count()));
  if (mode == Mode::kReadOnly) return connection;
  // SQLite quietly falls back to reading a file it may not write; a store must be writable.
  if (sqlite3_db_readonly(db, "main") == 1) {
    code = SQLITE_READONLY;
    error = "cannot open " + path + ": " + sqlite3_errstr(SQLITE_READONLY);
    return nullptr;
  }
  // auto_vacuum must come before the first table; on an existing store it is only a wish that
  // convertToIncrementalVacuum() fulfils.
  for (const std::string& sql :
       {std::string("PRAGMA auto_vacuum=INCREMENTAL"), std::string("PRAGMA journal_mode=WAL"),
        std::string("PRAGMA synchronous=NORMAL"),
        "PRAGMA journal_size_limit=" + std::to_string(kSXSqliteJournalSizeLimit), schema}) {
    if (auto failed = connection->exec(sql)) {
      code = sqlite3_errcode(db);
      error = "cannot open " + path + ": " + *failed;
      return nullptr;
    }
  }
  return connection;
}

namespace {

std::string DamagedSuffix() {
  std::time_t now = std::time(nullptr);
  std::tm utc{};
  gmtime_r(&now, &utc);
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%Y%m%d-%H%M%S", &utc);
  return std::string(".damaged-") + stamp;
}

// Renames `path` and its -wal and -shm files with the same new suffix; the database's own name.
std::optional<std::string> MoveAside(const std::string& path, std::string& aside) {
  std::string suffix = DamagedSuffix();
  std::error_code ec;
  for (int n = 2; std::filesystem::exists(path + suffix, ec); ++n) {
    suffix = DamagedSuffix() + "-" + std::to_string(n);
  }
  aside = path + suffix;
  if (::rename(path.c_str(), aside.c_str()) != 0) return SXPosixError("rename " + path, errno);
  for (const char* extra : {"-wal", "-shm"}) {
    // A stale log of the old file must not be replayed into the new one.
    std::string from = path + extra;
    if (::rename(from.c_str(), (aside + extra).c_str()) != 0 && errno != ENOENT) {
      ::unlink(from.c_str());
    }
  }
  return std::nullopt;
}

bool IsPermissionErrno(int errnum) {
  return errnum == EACCES || errnum == EPERM || errnum == EROFS;
}

// The error of a store left in place because this user may not write it.
std::string NotWritable(const std::string& path, const SXSqliteFileProbe& probe, int code) {
  const char* why = IsPermissionErrno(probe.accessErrno) ? std::strerror(probe.accessErrno)
                                                         : sqlite3_errstr(code);
  return "cannot open " + path + ": not writable by this user (" + why +
         "); left as it is, nothing is stored until its owner or mode is fixed";
}

}  // namespace

SXSqliteFileProbe SXSqliteProbeFile(const std::string& path) {
  SXSqliteFileProbe probe;
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) return probe;
  probe.exists = true;
  probe.regularFile = S_ISREG(st.st_mode);
  if (!probe.regularFile) return probe;
  // access(2), not open(2): closing a descriptor of the file would drop the POSIX locks that
  // another SQLite connection of this process holds on it. It reports an immutable file and a
  // read-only mount too, also to root.
  probe.accessErrno = ::faccessat(AT_FDCWD, path.c_str(), R_OK | W_OK, AT_EACCESS) == 0 ? 0 : errno;
  return probe;
}

SXSqliteOpenFailure SXSqliteClassifyOpenFailure(int code, const SXSqliteFileProbe& probe) {
  if (probe.exists && probe.regularFile && IsPermissionErrno(probe.accessErrno)) {
    return SXSqliteOpenFailure::kNotWritable;
  }
  switch (code & 0xff) {
    case SQLITE_READONLY:
      return SXSqliteOpenFailure::kNotWritable;
    case SQLITE_NOTADB:
    case SQLITE_CORRUPT:
      return SXSqliteOpenFailure::kDamaged;
    case SQLITE_CANTOPEN:
      // Out of descriptors or memory, the same code comes back for a healthy store, so only a
      // path that is no regular file counts as damage.
      return probe.exists && !probe.regularFile ? SXSqliteOpenFailure::kDamaged
                                                : SXSqliteOpenFailure::kOther;
    default:
      return SXSqliteOpenFailure::kOther;
  }
}

std::unique_ptr<SXSqliteConnection> SXSqliteConnection::openOrRecover(
    const std::string& path, std::chrono::milliseconds busyTimeout, const std::string& schema,
    std::string& error, std::string& recovered) {
  int code = SQLITE_OK;
  auto connection = openWithCode(path, Mode::kReadWrite, busyTimeout, schema, error, code);
  if (connection) {
    connection->convertToIncrementalVacuum();
    return connection;
  }
  SXSqliteFileProbe probe = SXSqliteProbeFile(path);
  switch (SXSqliteClassifyOpenFailure(code, probe)) {
    case SXSqliteOpenFailure::kNotWritable:
      error = NotWritable(path, probe, code);
      return nullptr;
    case SXSqliteOpenFailure::kOther:
      return nullptr;
    case SXSqliteOpenFailure::kDamaged:
      break;
  }
  std::string aside;
  if (auto failed = MoveAside(path, aside)) {
    error += "; cannot move it aside: " + *failed;
    return nullptr;
  }
  recovered = error + "; moved it to " + aside + " and started a new store";
  error.clear();
  return openWithCode(path, Mode::kReadWrite, busyTimeout, schema, error, code);
}

void SXSqliteConnection::convertToIncrementalVacuum() {
  constexpr int64_t kIncremental = 2;
  int64_t mode = 0;
  if (queryInt("PRAGMA auto_vacuum", {}, mode) || mode == kIncremental) return;
  // The copy holds the write lock and needs room for a second copy of the file. When it cannot
  // be made (busy, disk full) the store works as before and the next open tries again.
  exec("VACUUM");
}

std::optional<std::string> SXSqliteConnection::queryInt(const std::string& sql,
                                                        const SXSqliteRow& params, int64_t& value) {
  SXSqliteStatement statement;
  std::vector<SXValue> rows;
  if (auto failed = prepare(sql, statement)) return failed;
  if (auto failed = statement.query(params, rows)) return failed;
  value = 0;
  if (!rows.empty() && !rows[0].empty() && rows[0].begin()->is_number_integer()) {
    value = rows[0].begin()->get<int64_t>();
  }
  return std::nullopt;
}

std::optional<std::string> SXSqliteConnection::usedBytes(uint64_t& bytes) {
  int64_t used = 0;
  if (auto failed =
          queryInt("SELECT (p.page_count - f.freelist_count) * s.page_size "
                   "FROM pragma_page_count() p, pragma_freelist_count() f, pragma_page_size() s",
                   {}, used)) {
    return failed;
  }
  bytes = static_cast<uint64_t>(std::max<int64_t>(used, 0));
  return std::nullopt;
}

int64_t SXSqliteConnection::changes() const { return sqlite3_changes64(db_); }

SXSqliteConnection::~SXSqliteConnection() {
  // close_v2 defers the close until statements still alive are finalized.
  sqlite3_close_v2(db_);
}

std::optional<std::string> SXSqliteConnection::exec(const std::string& sql) {
  char* message = nullptr;
  int rc = sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, &message);
  if (rc == SQLITE_OK) return std::nullopt;
  std::string text = message ? message : sqlite3_errstr(rc);
  sqlite3_free(message);
  std::string first = sql.substr(0, sql.find_first_of(";("));
  return first + ": " + text;
}

std::optional<std::string> SXSqliteConnection::prepare(const std::string& sql,
                                                       SXSqliteStatement& out) {
  sqlite3_stmt* stmt = nullptr;
  int rc = sqlite3_prepare_v3(db_, sql.c_str(), static_cast<int>(sql.size()),
                              SQLITE_PREPARE_PERSISTENT, &stmt, nullptr);
  if (rc != SQLITE_OK) {
    sqlite3_finalize(stmt);
    return Describe(db_, "prepare \"" + sql + "\"");
  }
  out.stmt_.reset(stmt);
  out.db_ = db_;
  return std::nullopt;
}

int64_t SXSqliteConnection::lastInsertRowId() const { return sqlite3_last_insert_rowid(db_); }

double SXSqliteNow() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}
