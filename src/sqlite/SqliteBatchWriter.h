// A writer thread that appends rows to one SQLite table in batches, for stores whose callers
// must never wait on the disk (analytics events, power log).
//
// enqueue() hands over a row producer and returns at once, never waiting for the disk. The
// writer thread calls the producers (so lazy payloads are built there, not on the caller's
// thread) and commits whatever is queued, up to `maxBatch` rows, in one transaction.
//
// enqueue() and flush() may be called from any thread, but not from a row producer.
// Failures never reach the caller: a store that cannot be opened or a write that fails (full
// disk, a lock held too long) logs one error line on the default log of `log` and drops that
// batch; the next batch tries again, reopening the store if needed. A store file that is no
// usable database is moved aside and a new one created (SXSqliteConnection::openOrRecover),
// with an error line. The callers bound what they queue (the daemon holds back the clients
// whose rows wait); `maxQueued` is a last line of defence: a row offered while that many wait
// is dropped and counted as a write error, with one error line each time the queue fills.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include "platform/Log.h"
#include "sqlite/SqliteConnection.h"

class SXSqliteBatchWriter {
 public:
  // Builds one row's parameters for `insertSql`; runs on the writer thread. A producer that
  // throws loses its row (with an error line).
  using RowProducer = std::function<SXSqliteRow()>;

  struct Options {
    std::string path;
    std::string schema;     // CREATE TABLE IF NOT EXISTS ...
    std::string insertSql;  // INSERT ... VALUES (?1, ...)
    std::string rowNoun;    // "events": the word error lines use for rows
    std::string threadName;
    size_t maxQueued = 100'000;
    size_t maxBatch = 1'000;
    // How long the writer waits for a batch to fill before it commits what it has.
    std::chrono::milliseconds linger{2};
    std::chrono::milliseconds busyTimeout = kSXSqliteBusyTimeout;
  };

  // Opens the store at once, so that a store that cannot be opened is reported at start-up.
  SXSqliteBatchWriter(Options options, std::shared_ptr<SXLogFacility> log);
  // Commits everything queued, then joins the writer thread.
  ~SXSqliteBatchWriter();
  SXSqliteBatchWriter(const SXSqliteBatchWriter&) = delete;
  SXSqliteBatchWriter& operator=(const SXSqliteBatchWriter&) = delete;

  // Queues a row. Returns false when the writer is shutting down or the queue is full (the row
  // is then counted in writeErrors()). Not from a row producer.
  bool enqueue(RowProducer producer);

  // Returns once every row enqueued before the call has been committed or dropped.
  void flush();

  // Rows that were offered but could not be stored (the queue was full, the store could not be
  // opened or a commit failed). Any thread.
  uint64_t writeErrors() const;

 private:
  struct Core;
  std::shared_ptr<Core> core_;  // shared with the writer thread
  std::thread thread_;
};
