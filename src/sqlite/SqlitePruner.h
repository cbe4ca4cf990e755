// Deletes old rows from a store's tables and gives the space back, without stalling the
// store's writers: every delete is its own short transaction of at most `chunkRows` rows, and
// the pruner pauses between two of them (at least `pause`, and as long as the last one took),
// so that a writer waiting for the lock gets it.
//
// Every delete keeps the newest row of its table, so that row ids keep growing (SQLite gives
// a new row the highest id plus one, and the exporter's cursor relies on ids never coming
// back), and oldest rows go first.
//
// A pruner works on a connection its owner gives it and serialises (see SXSqliteConnection);
// it is used on one thread. On failure a method returns why; rows already deleted stay deleted
// and are counted.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>

#include "sqlite/SqliteConnection.h"

class SXSqlitePruner {
 public:
  struct Options {
    int64_t chunkRows = 1000;
    int64_t vacuumPages = 1024;  // pages given back to the file system per transaction
    std::chrono::milliseconds pause{5};
    const std::atomic<bool>* cancelled = nullptr;  // when set, the pruner stops between chunks
  };

  SXSqlitePruner(SXSqliteConnection& db, Options options) : db_(db), options_(options) {}

  // Deletes the rows of `table` whose `time` is before `cutoff` (seconds since the epoch) and
  // that also meet `condition` (SQL over the table's columns, "1" for all), oldest first. Rows
  // are taken in the order they were added, up to the first `chunkRows` of them that are all
  // younger than the cutoff: a row stamped older after a clock went back waits for its turn.
  SXStatus deleteOlderThan(const std::string& table, double cutoff, const std::string& condition,
                           uint64_t& deleted);

  // Deletes the rows of `table` whose id is at most `lastId`.
  SXStatus deleteThrough(const std::string& table, int64_t lastId, uint64_t& deleted);

  // Deletes the oldest rows of `table` (by id) while the database holds more than `maxBytes`
  // (SXSqliteConnection::usedBytes), among the rows there when it began.
  SXStatus deleteToSize(const std::string& table, uint64_t maxBytes, uint64_t& deleted);

  // Hands free pages back to the file system (incremental vacuum), then copies the WAL into
  // the database where no reader needs it (a passive checkpoint), so that the file shrinks.
  SXStatus releaseFreePages();

 private:
  // Deletes, chunk by chunk, up to `maxRows` rows of `table` that meet `condition` (with
  // `params` as ?1...), in `order`.
  SXStatus deleteInChunks(const std::string& table, const std::string& condition,
                          const std::string& order, const SXSqliteRow& params, int64_t maxRows,
                          uint64_t& deleted);
  bool cancelled() const { return options_.cancelled && options_.cancelled->load(); }
  void pauseAfter(std::chrono::steady_clock::time_point start) const;

  SXSqliteConnection& db_;
  const Options options_;
};
