// A SQLite connection and its prepared statements: the one place the durable stores (analytics
// events, power log, server-reporting spool) talk to libsqlite3.
//
// Errors are values: every call that can fail returns a status (platform/Status.h) whose
// failure text is "<context>: <what SQLite says>". Nothing throws.
//
// A connection and its statements are not thread-safe: their owner serialises every call (a
// writer thread of its own, or a mutex). A statement must not outlive its connection.
#pragma once

#include <sqlite3.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "platform/Status.h"
#include "sxreporting/types.h"

// One bound parameter or one stored column.
// Text is bound as it is, never copied: a shared text lets a row point at one that the caller
// also keeps (null binds NULL).
using SXSqliteField =
    std::variant<std::nullptr_t, int64_t, double, std::string, std::shared_ptr<const std::string>>;
using SXSqliteRow = std::vector<SXSqliteField>;

// How long a write waits for another connection's lock before it fails.
inline constexpr std::chrono::milliseconds kSXSqliteBusyTimeout{5000};
// What a WAL file is cut back to after a checkpoint, so that one burst does not leave it large.
inline constexpr int64_t kSXSqliteJournalSizeLimit = 4 << 20;
// The page size of a new store. Rows are appended a few hundred bytes at a time, and each commit
// writes every page it touched to the WAL one system call per page: bigger pages cost fewer
// calls for the same bytes. An existing store keeps the page size it was made with.
inline constexpr int kSXSqlitePageSize = 16384;

// How many rows a store's writer inserts with one statement. Each run of a statement costs
// about a third of what inserting a few-hundred-byte row does (its reset, step and set-up), so
// a batch goes in blocks of this many rows.
inline constexpr size_t kSXSqliteRowsPerInsert = 16;

// `insertSql` ("INSERT INTO t(a, b) VALUES (?1, ?2)", one row of plain parameters) made to
// insert `rows` rows at once.
std::string SXSqliteInsertOfRows(const std::string& insertSql, size_t rows);

class SXSqliteStatement {
 public:
  SXSqliteStatement() = default;
  SXSqliteStatement(SXSqliteStatement&&) = default;
  SXSqliteStatement& operator=(SXSqliteStatement&&) = default;

  explicit operator bool() const { return stmt_ != nullptr; }

  // Binds `params` to ?1..?n, steps until done and resets.
  SXStatus run(const SXSqliteRow& params);
  // The same for a statement of several rows (SXSqliteInsertOfRows): each row's fields follow
  // the previous row's, and every row must have as many as the statement has columns.
  SXStatus run(std::span<const SXSqliteRow* const> rows);

  // Binds `params` and appends each result row to `rows` as an object keyed by column name
  // (integers, floating values, texts, nulls; blobs as texts).
  SXStatus query(const SXSqliteRow& params, std::vector<SXValue>& rows);

 private:
  friend class SXSqliteConnection;
  struct Finalizer {
    void operator()(sqlite3_stmt* stmt) const { sqlite3_finalize(stmt); }
  };

  SXStatus bind(std::span<const SXSqliteRow* const> rows);
  int bindField(int index, const SXSqliteField& field);
  std::string failure(const char* context) const;

  std::unique_ptr<sqlite3_stmt, Finalizer> stmt_;
  sqlite3* db_ = nullptr;  // the connection that prepared it, for its error text
};

class SXSqliteConnection {
 public:
  enum class Mode { kReadWrite, kReadOnly };

  // Opens `path`. Read-write creates the file (with incremental auto-vacuum), switches it to
  // WAL with synchronous=NORMAL (committed rows survive a crash of this process, not a power
  // loss), checkpoints the WAL when it reaches kSXSqliteJournalSizeLimit and runs `schema`; a
  // file that can only be opened for reading is a failure (SQLITE_READONLY).
  // Both modes wait up to `busyTimeout` for another connection's lock.
  static SXResult<std::unique_ptr<SXSqliteConnection>> open(const std::string& path, Mode mode,
                                                            std::chrono::milliseconds busyTimeout,
                                                            const std::string& schema);

  // Opens `path` read-write like open(), and converts a store made without incremental
  // auto-vacuum once (a VACUUM: it holds the write lock while it copies the file, so only the
  // store's owner calls this, before others use the store). When the file is there but is no usable
  // database (not a database, damaged, or not a regular file), it and its -wal and -shm files are
  // renamed with the suffix ".damaged-<yyyyMMdd-HHmmss>" and a new store is created; `recovered`
  // then says what was moved where, for the owner's error line. A store this user may not write
  // (see SXSqliteClassifyOpenFailure), a busy store or a full disk is never moved aside (the
  // failure then says "... not writable by this user ..." for the permissions problem).
  static SXResult<std::unique_ptr<SXSqliteConnection>> openOrRecover(
      const std::string& path, std::chrono::milliseconds busyTimeout, const std::string& schema,
      std::string& recovered);

  struct Key {  // only open() makes connections
   private:
    friend class SXSqliteConnection;
    Key() = default;
  };
  SXSqliteConnection(Key, sqlite3* db) : db_(db) {}
  ~SXSqliteConnection();
  SXSqliteConnection(const SXSqliteConnection&) = delete;
  SXSqliteConnection& operator=(const SXSqliteConnection&) = delete;

  // Runs one or more statements that return nothing of interest.
  SXStatus exec(const std::string& sql);
  SXStatus prepare(const std::string& sql, SXSqliteStatement& out);
  int64_t lastInsertRowId() const;
  // Rows the last INSERT, UPDATE or DELETE changed.
  int64_t changes() const;
  // The integer that `sql`, a query of one column, returns in its first row (0 when there is
  // no row or no integer).
  SXResult<int64_t> queryInt(const std::string& sql, const SXSqliteRow& params);
  // The bytes the database's pages hold: (page_count - freelist_count) * page_size.
  SXResult<uint64_t> usedBytes();

 private:
  void convertToIncrementalVacuum();

  // open(), also saying which SQLite result code made it fail (SQLITE_OK on success).
  static SXResult<std::unique_ptr<SXSqliteConnection>> openWithCode(
      const std::string& path, Mode mode, std::chrono::milliseconds busyTimeout,
      const std::string& schema, int& code);

  sqlite3* db_;
};

// Why a store could not be opened read-write, which decides whether it is moved aside.
enum class SXSqliteOpenFailure {
  kDamaged,      // not a database, damaged, or not a regular file: moved aside and replaced
  kNotWritable,  // a permissions problem (owner, mode, immutable, read-only mount): kept
  kOther,        // busy, disk full, out of descriptors, a missing directory: kept
};

// What the file at a store's path is, as far as telling damage from permissions needs.
struct SXSqliteFileProbe {
  bool exists = false;
  bool regularFile = false;
  int accessErrno = 0;  // errno of access(2) for reading and writing; 0 when that is allowed
};

// Looks at `path` with stat(2) and access(2) (with the effective user and group).
SXSqliteFileProbe SXSqliteProbeFile(const std::string& path);

// `code` is the SQLite result of the failed open. A file this user cannot open for writing
// (EACCES, EPERM, EROFS, or SQLITE_READONLY) is kNotWritable even when it is also damaged:
// moving it aside would hide the permissions problem, and the next start after it is fixed
// still recovers it.
SXSqliteOpenFailure SXSqliteClassifyOpenFailure(int code, const SXSqliteFileProbe& probe);

// Seconds since the Unix epoch, the unit of every `time` column.
double SXSqliteNow();
