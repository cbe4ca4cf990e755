#include "sqlite/SqliteConnection.h"

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

std::string SXSqliteInsertOfRows(const std::string& insertSql, size_t rows) {
  size_t values = insertSql.rfind("VALUES");
  if (values == std::string::npos || rows == 0) return insertSql;
  size_t open = insertSql.find('(', values);
  size_t close = insertSql.find(')', open);
  if (open == std::string::npos || close == std::string::npos) return insertSql;
  std::string_view tuple = std::string_view(insertSql).substr(open, close - open);
  auto width = static_cast<size_t>(std::count(tuple.begin(), tuple.end(), '?'));
  std::string row = "(";
  for (size_t i = 0; i < width; ++i) row += i == 0 ? "?" : ", ?";
  row += ')';
  std::string sql = insertSql.substr(0, open);
  for (size_t i = 0; i < rows; ++i) sql += (i == 0 ? "" : ", ") + row;
  return sql + insertSql.substr(close + 1);
}

int SXSqliteStatement::bindField(int index, const SXSqliteField& field) {
  return std::visit(
      [&](const auto& v) -> int {
        using T = std::decay_t<decltype(v)>;
        if constexpr (std::is_same_v<T, std::nullptr_t>) {
          return sqlite3_bind_null(stmt_.get(), index);
        } else if constexpr (std::is_same_v<T, int64_t>) {
          return sqlite3_bind_int64(stmt_.get(), index, v);
        } else if constexpr (std::is_same_v<T, double>) {
          return sqlite3_bind_double(stmt_.get(), index, v);
        } else if constexpr (std::is_same_v<T, std::shared_ptr<const std::string>>) {
          if (!v) return sqlite3_bind_null(stmt_.get(), index);
          return sqlite3_bind_text64(stmt_.get(), index, v->data(), v->size(), SQLITE_STATIC,
                                     SQLITE_UTF8);
        } else {
          return sqlite3_bind_text64(stmt_.get(), index, v.data(), v.size(), SQLITE_STATIC,
                                     SQLITE_UTF8);
        }
      },
      field);
}

SXStatus SXSqliteStatement::bind(std::span<const SXSqliteRow* const> rows) {
  if (!stmt_) return SXFailure("statement was never prepared");
  // Every run and query clears the bindings it leaves, and so does a bind that fails.
  sqlite3_reset(stmt_.get());
  // A short row among several would shift the rows after it into the wrong columns.
  if (rows.size() > 1) {
    size_t width = static_cast<size_t>(sqlite3_bind_parameter_count(stmt_.get())) / rows.size();
    for (const SXSqliteRow* row : rows) {
      if (row->size() != width) {
        return SXFailure(failure("bind") + ": a row of " + std::to_string(row->size()) +
                         " values for " + std::to_string(width) + " columns");
      }
    }
  }
  int index = 0;
  for (const SXSqliteRow* row : rows) {
    for (const SXSqliteField& field : *row) {
      if (bindField(++index, field) != SQLITE_OK) {
        SXStatus failed = SXFailure(failure("bind"));
        sqlite3_clear_bindings(stmt_.get());
        return failed;
      }
    }
  }
  return {};
}

SXStatus SXSqliteStatement::run(const SXSqliteRow& params) {
  const SXSqliteRow* rows[] = {&params};
  return run(rows);
}

SXStatus SXSqliteStatement::run(std::span<const SXSqliteRow* const> rows) {
  if (SXStatus bound = bind(rows); !bound.ok()) return bound;
  int rc;
  while ((rc = sqlite3_step(stmt_.get())) == SQLITE_ROW) {
  }
  SXStatus status;
  if (rc != SQLITE_DONE) status = SXFailure(failure("step"));
  // Resetting releases the statement's read of the database and the bound texts (SQLITE_STATIC).
  sqlite3_reset(stmt_.get());
  sqlite3_clear_bindings(stmt_.get());
  return status;
}

SXStatus SXSqliteStatement::query(const SXSqliteRow& params, std::vector<SXValue>& rows) {
  const SXSqliteRow* bound[] = {&params};
  if (SXStatus failed = bind(bound); !failed.ok()) return failed;
  int rc;
  int columns = sqlite3_column_count(stmt_.get());
  while ((rc = sqlite3_step(stmt_.get())) == SQLITE_ROW) {
    SXValue row = SXValue::object();
    for (int c = 0; c < columns; ++c) {
      row[sqlite3_column_name(stmt_.get(), c)] = ColumnValue(stmt_.get(), c);
    }
    rows.push_back(std::move(row));
  }
  SXStatus status;
  if (rc != SQLITE_DONE) status = SXFailure(failure("step"));
  sqlite3_reset(stmt_.get());
  sqlite3_clear_bindings(stmt_.get());
  return status;
}

SXResult<std::unique_ptr<SXSqliteConnection>> SXSqliteConnection::open(
    const std::string& path, Mode mode, std::chrono::milliseconds busyTimeout,
    const std::string& schema) {
  int code = SQLITE_OK;
  return openWithCode(path, mode, busyTimeout, schema, code);
}

SXResult<std::unique_ptr<SXSqliteConnection>> SXSqliteConnection::openWithCode(
    const std::string& path, Mode mode, std::chrono::milliseconds busyTimeout,
    const std::string& schema, int& code) {
  // SQLite's memory statistics take a process-wide mutex on every allocation; nothing reads
  // them. Only possible before SQLite's first use (later it is refused and changes nothing).
  static const bool noMemoryStatistics = sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0) == SQLITE_OK;
  (void)noMemoryStatistics;
  sqlite3* db = nullptr;
  int flags =
      mode == Mode::kReadOnly ? SQLITE_OPEN_READONLY : SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE;
  // The owner serialises calls, so SQLite's own per-connection mutex is not needed.
  code = sqlite3_open_v2(path.c_str(), &db, flags | SQLITE_OPEN_NOMUTEX, nullptr);
  if (code != SQLITE_OK) {
    SXStatus failed = SXFailure(Describe(db, "cannot open " + path));
    sqlite3_close_v2(db);
    return failed;
  }
  auto connection = std::make_unique<SXSqliteConnection>(Key(), db);
  sqlite3_busy_timeout(db, static_cast<int>(busyTimeout.count()));
  if (mode == Mode::kReadOnly) return connection;
  // SQLite quietly falls back to reading a file it may not write; a store must be writable.
  if (sqlite3_db_readonly(db, "main") == 1) {
    code = SQLITE_READONLY;
    return SXFailure("cannot open " + path + ": " + sqlite3_errstr(SQLITE_READONLY));
  }
  // page_size and auto_vacuum must come before the first table; on an existing store they are
  // no-ops (auto_vacuum is then a wish that convertToIncrementalVacuum() fulfils).
  for (const std::string& sql :
       {"PRAGMA page_size=" + std::to_string(kSXSqlitePageSize),
        std::string("PRAGMA auto_vacuum=INCREMENTAL"), std::string("PRAGMA journal_mode=WAL"),
        std::string("PRAGMA synchronous=NORMAL"),
        "PRAGMA journal_size_limit=" + std::to_string(kSXSqliteJournalSizeLimit), schema}) {
    if (SXStatus failed = connection->exec(sql); !failed.ok()) {
      code = sqlite3_errcode(db);
      return SXFailure("cannot open " + path + ": " + failed.error());
    }
  }
  // Checkpoint when the WAL reaches its cap rather than at SQLite's 1,000 pages, so that the
  // WAL is written over in place instead of being cut back and grown again after every
  // checkpoint.
  if (SXResult<int64_t> pageSize = connection->queryInt("PRAGMA page_size", {});
      pageSize.ok() && *pageSize > 0) {
    (void)connection->exec("PRAGMA wal_autocheckpoint=" +
                           std::to_string(kSXSqliteJournalSizeLimit / *pageSize));
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
SXStatus MoveAside(const std::string& path, std::string& aside) {
  std::string suffix = DamagedSuffix();
  std::error_code ec;
  for (int n = 2; std::filesystem::exists(path + suffix, ec); ++n) {
    suffix = DamagedSuffix() + "-" + std::to_string(n);
  }
  aside = path + suffix;
  if (::rename(path.c_str(), aside.c_str()) != 0) return SXErrnoStatus("rename " + path, errno);
  for (const char* extra : {"-wal", "-shm"}) {
    // A stale log of the old file must not be replayed into the new one.
    std::string from = path + extra;
    if (::rename(from.c_str(), (aside + extra).c_str()) != 0 && errno != ENOENT) {
      ::unlink(from.c_str());
    }
  }
  return {};
}

bool IsPermissionErrno(int errnum) {
  return errnum == EACCES || errnum == EPERM || errnum == EROFS;
}

// The error of a store left in place because this user may not write it.
std::string NotWritable(const std::string& path, const SXSqliteFileProbe& probe, int code) {
  const std::string why =
      IsPermissionErrno(probe.accessErrno) ? SXErrnoText(probe.accessErrno) : sqlite3_errstr(code);
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

SXResult<std::unique_ptr<SXSqliteConnection>> SXSqliteConnection::openOrRecover(
    const std::string& path, std::chrono::milliseconds busyTimeout, const std::string& schema,
    std::string& recovered) {
  int code = SQLITE_OK;
  auto connection = openWithCode(path, Mode::kReadWrite, busyTimeout, schema, code);
  if (connection.ok()) {
    (*connection)->convertToIncrementalVacuum();
    return connection;
  }
  SXSqliteFileProbe probe = SXSqliteProbeFile(path);
  switch (SXSqliteClassifyOpenFailure(code, probe)) {
    case SXSqliteOpenFailure::kNotWritable:
      return SXFailure(NotWritable(path, probe, code));
    case SXSqliteOpenFailure::kOther:
      return connection;
    case SXSqliteOpenFailure::kDamaged:
      break;
  }
  std::string aside;
  if (SXStatus moved = MoveAside(path, aside); !moved.ok()) {
    return SXFailure(connection.error() + "; cannot move it aside: " + moved.error());
  }
  recovered = connection.error() + "; moved it to " + aside + " and started a new store";
  return openWithCode(path, Mode::kReadWrite, busyTimeout, schema, code);
}

void SXSqliteConnection::convertToIncrementalVacuum() {
  constexpr int64_t kIncremental = 2;
  SXResult<int64_t> mode = queryInt("PRAGMA auto_vacuum", {});
  if (!mode.ok() || *mode == kIncremental) return;
  // The copy holds the write lock and needs room for a second copy of the file. When it cannot
  // be made (busy, disk full) the store works as before and the next open tries again.
  (void)exec("VACUUM");
}

SXResult<int64_t> SXSqliteConnection::queryInt(const std::string& sql, const SXSqliteRow& params) {
  SXSqliteStatement statement;
  std::vector<SXValue> rows;
  if (SXStatus failed = prepare(sql, statement); !failed.ok()) return failed;
  if (SXStatus failed = statement.query(params, rows); !failed.ok()) return failed;
  if (!rows.empty() && !rows[0].empty() && rows[0].begin()->is_number_integer()) {
    return rows[0].begin()->get<int64_t>();
  }
  return int64_t{0};
}

SXResult<uint64_t> SXSqliteConnection::usedBytes() {
  SXResult<int64_t> used = queryInt(
      "SELECT (p.page_count - f.freelist_count) * s.page_size "
      "FROM pragma_page_count() p, pragma_freelist_count() f, pragma_page_size() s",
      {});
  if (!used.ok()) return used.status();
  return static_cast<uint64_t>(std::max<int64_t>(*used, 0));
}

int64_t SXSqliteConnection::changes() const { return sqlite3_changes64(db_); }

SXSqliteConnection::~SXSqliteConnection() {
  // close_v2 defers the close until statements still alive are finalized.
  sqlite3_close_v2(db_);
}

SXStatus SXSqliteConnection::exec(const std::string& sql) {
  char* message = nullptr;
  int rc = sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, &message);
  if (rc == SQLITE_OK) return {};
  std::string text = message ? message : sqlite3_errstr(rc);
  sqlite3_free(message);
  std::string first = sql.substr(0, sql.find_first_of(";("));
  return SXFailure(first + ": " + text);
}

SXStatus SXSqliteConnection::prepare(const std::string& sql, SXSqliteStatement& out) {
  sqlite3_stmt* stmt = nullptr;
  int rc = sqlite3_prepare_v3(db_, sql.c_str(), static_cast<int>(sql.size()),
                              SQLITE_PREPARE_PERSISTENT, &stmt, nullptr);
  if (rc != SQLITE_OK) {
    sqlite3_finalize(stmt);
    return SXFailure(Describe(db_, "prepare \"" + sql + "\""));
  }
  out.stmt_.reset(stmt);
  out.db_ = db_;
  return {};
}

int64_t SXSqliteConnection::lastInsertRowId() const { return sqlite3_last_insert_rowid(db_); }

double SXSqliteNow() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}
