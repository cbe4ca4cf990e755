// Keeps the daemon's files within the retention policy, so that it can run for months
// unattended. Each pass, on a background queue of its own (never the I/O thread or the server
// queue):
//   - tallyvane.db (events), joulebook.db (entries), fernreporting.db (messages): rows older
//     than maxAgeDays, then the oldest rows while the store holds more than maxBytes; the spool
//     also drops the messages the "otlp-http" exporter has taken (at or below its cursor in
//     otlp_export), flushes older than maxAgeDays, and sessions older than that which no
//     message refers to; then free pages go back to the file system;
//   - the session summary files (`*-sonex-*.json` in the diagnostic-logs directory) older
//     than their maxAgeDays, and the oldest beyond maxFiles;
//   - the damaged copies of stores (`*.damaged-<UTC time>*` in the state directory) moved
//     aside longer ago than their maxAgeDays.
// The work is done with SXSqlitePruner on a connection of its own per store and pass, in
// small transactions that let the stores' writers in between.
//
// Threads: every method may be called from any thread. A failure (a store that is busy,
// missing or damaged) logs an error line, once until the error changes, and the next pass
// tries again.
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <string>

#include "common/SXThreadSafety.h"
#include "platform/Dispatch.h"
#include "platform/Log.h"
#include "sqlite/RetentionPolicy.h"
#include "sqlite/SqlitePruner.h"

class SXRetention : public std::enable_shared_from_this<SXRetention> {
 public:
  struct Options {
    std::string stateDir;
    std::string diagnosticLogsDir;
    std::shared_ptr<SXDispatch> dispatch;
    std::shared_ptr<SXLogFacility> log;
    SXSqlitePruner::Options pruning = {};  // `cancelled` is set by SXRetention
  };

  static std::shared_ptr<SXRetention> create(Options options, SXRetentionPolicy policy);
  SXRetention(const SXRetention&) = delete;
  SXRetention& operator=(const SXRetention&) = delete;

  // Schedules the first pass (after the interval, at most 10 s) and then one pass every
  // interval. Once.
  void start();
  // Ends the pass in progress after its current chunk; no pass starts after it.
  void stop();

  // Takes effect from the next pass (the next interval too).
  void setPolicy(const SXRetentionPolicy& policy);
  // Whether "otlp-http" is a backend now: spooled messages it has exported are then pruned at
  // once. From the next pass.
  void setSpoolExported(bool exported) { spoolExported_.store(exported); }
  SXRetentionPolicy policy() const;

  // One pass now, on the caller's thread; passes never overlap.
  void runPass();

  // For status: {"rows_pruned": {store: N}, "files_aged_out": {"summary": N, "damaged": N}}
  // since start, and {"store_bytes": {store: N}} as measured by the last pass (absent before
  // it). Stores are named as in store_write_errors: tallyvane, joulebook, fernreporting.
  SXValue counters() const;
  SXValue gauges() const;

 private:
  static constexpr size_t kStores = 3;  // tallyvane, joulebook, fernreporting

  explicit SXRetention(Options options, SXRetentionPolicy policy);
  void scheduleNext(std::chrono::nanoseconds delay);
  void pruneStore(size_t index, const SXStoreRetention& limits) SX_REQUIRES(passMutex_);
  SXStatus pruneSpoolExtras(SXSqlitePruner& pruner, double cutoff, SXSqliteConnection& db,
                            uint64_t& deleted);
  void ageOutFiles(const SXRetentionPolicy& policy) SX_REQUIRES(passMutex_);
  void reportError(size_t slot, const std::string& error) SX_REQUIRES(passMutex_);

  Options options_;
  const std::shared_ptr<SXWorkQueue> queue_;
  std::atomic<bool> stopped_{false};
  std::atomic<bool> spoolExported_{false};
  mutable SXMutex policyMutex_;
  SXRetentionPolicy policy_ SX_GUARDED_BY(policyMutex_);
  SXMutex passMutex_;  // held for a whole pass
  std::array<std::string, kStores + 1> lastErrors_ SX_GUARDED_BY(passMutex_);  // the last: files
  std::array<std::atomic<uint64_t>, kStores> rowsPruned_{};
  std::array<std::atomic<int64_t>, kStores> storeBytes_{};  // -1 until measured
  std::atomic<uint64_t> summaryFilesRemoved_{0};
  std::atomic<uint64_t> damagedCopiesRemoved_{0};
};
