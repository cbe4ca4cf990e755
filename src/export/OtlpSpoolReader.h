// The exporter's view of the server-reporting spool: the messages beyond its cursor, and the
// cursor itself, kept durably in the spool's own database as the one row of
// otlp_export(id INTEGER PRIMARY KEY CHECK(id = 1), last_message_id INTEGER NOT NULL).
//
// It opens a connection of its own on the spool file (the spool's writer keeps its own), so a
// read never waits for the writer (WAL) and the cursor write waits at most the busy time-out.
// Row ids only grow, because writes are serialised and nothing deletes rows, so a cursor on
// `messages.id` never skips a message committed after it was read.
//
// All methods may be called from any thread; a mutex serialises them. A failure says
// "<path>: <what SQLite says>", and the next call opens the database again.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "common/SXThreadSafety.h"
#include "sqlite/SqliteConnection.h"

class SXOtlpSpoolReader {
 public:
  explicit SXOtlpSpoolReader(std::string dbPath,
                             std::chrono::milliseconds busyTimeout = kSXSqliteBusyTimeout);
  ~SXOtlpSpoolReader();
  SXOtlpSpoolReader(const SXOtlpSpoolReader&) = delete;
  SXOtlpSpoolReader& operator=(const SXOtlpSpoolReader&) = delete;

  // Appends to `rows` the next messages beyond the cursor, in id order: at most `limit`, and
  // no more once their payloads pass `maxBytes` (one at least). Each row is an object with the
  // columns of SXOtlpSpooledRow; a session message has its session's info, user info and token.
  SXStatus read(size_t limit, size_t maxBytes, std::vector<SXValue>& rows);

  // Moves the cursor to `lastMessageId`, at once in memory (read() goes on from there) and
  // durably. When the durable write fails the cursor still moves in memory, and the write is
  // tried again by the next read() or advance().
  SXStatus advance(int64_t lastMessageId);

  // The cursor: the id of the last message done with; 0 before the first.
  int64_t cursor() const;

  // Messages beyond the cursor, counted now; on failure, the last count (0 before any).
  uint64_t backlog() const;

 private:
  struct Db;

  SXStatus ensureOpen() SX_REQUIRES(mutex_);
  SXStatus persistCursor() SX_REQUIRES(mutex_);
  SXStatus fail(const SXStatus& failed) SX_REQUIRES(mutex_);

  const std::string path_;
  const std::chrono::milliseconds busyTimeout_;
  mutable SXMutex mutex_;
  std::unique_ptr<Db> db_ SX_GUARDED_BY(mutex_);  // null while closed
  int64_t cursor_ SX_GUARDED_BY(mutex_) = 0;
  bool cursorLoaded_ SX_GUARDED_BY(mutex_) = false;  // read from the database once
  bool cursorDirty_ SX_GUARDED_BY(mutex_) = false;   // moved, not yet stored
  mutable uint64_t lastBacklog_ SX_GUARDED_BY(mutex_) = 0;
};
