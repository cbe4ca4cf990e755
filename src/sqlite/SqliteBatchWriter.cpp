#include "sqlite/SqliteBatchWriter.h"

#include <pthread.h>

#include <atomic>
#include <condition_variable>
#include <deque>
#include <exception>
#include <mutex>

#include "common/SXThreadSafety.h"
#include "platform/DiscardLog.h"

struct SXSqliteBatchWriter::Core {
  Core(Options o, std::shared_ptr<SXLogFacility> l)
      : options(std::move(o)), log(SXLogOrDiscard(std::move(l))) {}

  void run();
  // REQUIRES: writer thread (or the constructor, before the thread starts).
  SXStatus ensureOpen();
  void writeBatch(std::vector<RowProducer>& batch);
  SXStatus commit(const std::vector<SXSqliteRow>& rows);
  std::vector<SXSqliteRow> produceRows(std::vector<RowProducer>& batch);

  const Options options;
  const std::shared_ptr<SXLogFacility> log;

  SXMutex mutex;
  std::condition_variable wake;      // rows queued or stopping
  std::condition_variable progress;  // `done` advanced
  std::deque<RowProducer> queue SX_GUARDED_BY(mutex);
  uint64_t enqueued SX_GUARDED_BY(mutex) = 0;  // rows ever accepted
  uint64_t done SX_GUARDED_BY(mutex) = 0;      // rows committed or dropped
  bool full SX_GUARDED_BY(mutex) = false;      // rows are being refused
  bool stopping SX_GUARDED_BY(mutex) = false;
  int flushWaiters SX_GUARDED_BY(mutex) = 0;  // flush() calls waiting
  std::atomic<uint64_t> writeErrors{0};       // rows lost to a store that failed; any thread reads

  // Writer thread only. The statement is declared after the connection it belongs to, so it
  // is finalized first.
  std::unique_ptr<SXSqliteConnection> db;
  SXSqliteStatement insert;
  SXSqliteStatement insertBlock;  // kSXSqliteRowsPerInsert rows at once
};

SXStatus SXSqliteBatchWriter::Core::ensureOpen() {
  if (db) return {};
  std::string recovered;
  auto connection = SXSqliteConnection::openOrRecover(options.path, options.busyTimeout,
                                                      options.schema, recovered);
  if (!recovered.empty()) SXLOG(*log, nullptr, SXLogLevel::kError, "%s", recovered);
  if (!connection.ok()) return connection.status();
  SXSqliteStatement statement;
  SXSqliteStatement block;
  SXStatus failed = (*connection)->prepare(options.insertSql, statement);
  if (failed.ok()) {
    failed = (*connection)
                 ->prepare(SXSqliteInsertOfRows(options.insertSql, kSXSqliteRowsPerInsert), block);
  }
  if (!failed.ok()) return SXFailure(options.path + ": " + failed.error());
  db = std::move(*connection);
  insert = std::move(statement);
  insertBlock = std::move(block);
  return {};
}

std::vector<SXSqliteRow> SXSqliteBatchWriter::Core::produceRows(std::vector<RowProducer>& batch) {
  std::vector<SXSqliteRow> rows;
  rows.reserve(batch.size());
  for (auto& producer : batch) {
    try {
      rows.push_back(producer());
    } catch (const std::exception& e) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "%s: could not build one of the %s: %s",
            options.path, options.rowNoun, e.what());
    } catch (...) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "%s: could not build one of the %s", options.path,
            options.rowNoun);
    }
  }
  return rows;
}

SXStatus SXSqliteBatchWriter::Core::commit(const std::vector<SXSqliteRow>& rows) {
  if (SXStatus failed = db->exec("BEGIN IMMEDIATE"); !failed.ok()) return failed;
  for (size_t i = 0; i < rows.size();) {
    const SXSqliteRow* block[kSXSqliteRowsPerInsert];
    size_t n = rows.size() - i >= kSXSqliteRowsPerInsert ? kSXSqliteRowsPerInsert : 1;
    for (size_t k = 0; k < n; ++k) block[k] = &rows[i + k];
    SXSqliteStatement& statement = n == 1 ? insert : insertBlock;
    if (SXStatus failed = statement.run(std::span(block, n)); !failed.ok()) {
      (void)db->exec("ROLLBACK");
      return failed;
    }
    i += n;
  }
  if (SXStatus failed = db->exec("COMMIT"); !failed.ok()) {
    (void)db->exec("ROLLBACK");
    return failed;
  }
  return {};
}

void SXSqliteBatchWriter::Core::writeBatch(std::vector<RowProducer>& batch) {
  std::vector<SXSqliteRow> rows = produceRows(batch);
  if (rows.empty()) return;
  if (SXStatus opened = ensureOpen(); !opened.ok()) {
    writeErrors += rows.size();
    SXLOG(*log, nullptr, SXLogLevel::kError, "dropped %zu %s: %s", rows.size(), options.rowNoun,
          opened.error());
    return;
  }
  if (SXStatus failed = commit(rows); !failed.ok()) {
    writeErrors += rows.size();
    SXLOG(*log, nullptr, SXLogLevel::kError, "dropped %zu %s: %s: %s", rows.size(), options.rowNoun,
          options.path, failed.error());
    // Start the next batch on a fresh connection, in case this one is what went wrong.
    insert = SXSqliteStatement();
    insertBlock = SXSqliteStatement();
    db.reset();
  }
}

void SXSqliteBatchWriter::Core::run() {
  for (;;) {
    std::vector<RowProducer> batch;
    {
      SXMutexLock lock(mutex);
      lock.wait(wake, [&]() SX_REQUIRES(mutex) { return stopping || !queue.empty(); });
      if (queue.empty()) return;  // stopping, and everything is written
      // Rows come one at a time; waiting a moment for more turns a stream of them into a few
      // large transactions, at a fraction of the cost per row (and of the wake-ups).
      lock.waitFor(wake, options.linger, [&]() SX_REQUIRES(mutex) {
        return stopping || flushWaiters > 0 || queue.size() >= options.maxBatch;
      });
      size_t n = std::min(queue.size(), options.maxBatch);
      batch.assign(std::make_move_iterator(queue.begin()),
                   std::make_move_iterator(queue.begin() + static_cast<ptrdiff_t>(n)));
      queue.erase(queue.begin(), queue.begin() + static_cast<ptrdiff_t>(n));
      if (full && queue.size() < options.maxQueued / 2) full = false;
    }
    size_t n = batch.size();
    writeBatch(batch);
    batch.clear();  // producers release what they hold before flush() learns of it
    {
      SXMutexLock lock(mutex);
      done += n;
    }
    progress.notify_all();
  }
}

SXSqliteBatchWriter::SXSqliteBatchWriter(Options options, std::shared_ptr<SXLogFacility> log)
    : core_(std::make_shared<Core>(std::move(options), std::move(log))) {
  if (SXStatus opened = core_->ensureOpen(); !opened.ok()) {
    SXLOG(*core_->log, nullptr, SXLogLevel::kError, "%s", opened.error());
  }
  thread_ = std::thread([core = core_] {
    pthread_setname_np(pthread_self(), core->options.threadName.substr(0, 15).c_str());
    core->run();
  });
}

SXSqliteBatchWriter::~SXSqliteBatchWriter() {
  {
    SXMutexLock lock(core_->mutex);
    core_->stopping = true;
  }
  core_->wake.notify_all();
  // A producer may hold the last reference to our owner, so the writer thread can end up here;
  // it cannot join itself, and it drains the queue on its own (it shares the core).
  if (thread_.get_id() == std::this_thread::get_id()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

bool SXSqliteBatchWriter::enqueue(RowProducer producer) {
  Core& core = *core_;
  {
    SXMutexLock lock(core.mutex);
    if (core.stopping) return false;
    if (core.queue.size() >= core.options.maxQueued) {
      core.writeErrors++;
      if (!core.full) {
        core.full = true;
        SXLOG(*core.log, nullptr, SXLogLevel::kError,
              "%s: %zu %s wait to be written; dropping new ones until half of them are",
              core.options.path, core.options.maxQueued, core.options.rowNoun);
      }
      return false;
    }
    core.queue.push_back(std::move(producer));
    ++core.enqueued;
    // The writer needs waking only when it waits for a first row or has a full batch; while
    // it lingers for a batch to gather, waking it for every row would undo the gathering.
    size_t queued = core.queue.size();
    if (queued != 1 && queued != core.options.maxBatch) return true;
  }
  core.wake.notify_one();
  return true;
}

void SXSqliteBatchWriter::flush() {
  SXMutexLock lock(core_->mutex);
  uint64_t target = core_->enqueued;
  ++core_->flushWaiters;
  core_->wake.notify_one();  // no lingering for rows that someone waits for
  lock.wait(core_->progress, [&]() SX_REQUIRES(core_->mutex) { return core_->done >= target; });
  --core_->flushWaiters;
}

uint64_t SXSqliteBatchWriter::writeErrors() const { return core_->writeErrors.load(); }
