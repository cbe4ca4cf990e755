#include "sqlite/Retention.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <functional>
#include <vector>

#include "platform/DiscardLog.h"

namespace fs = std::filesystem;

namespace {

struct PrunedStore {
  const char* name;  // as in status
  const char* file;
  const char* table;  // the table pruned by age and size
  SXStoreRetention SXRetentionPolicy::*limits;
};

constexpr size_t kSpool = 2;
constexpr PrunedStore kPrunedStores[] = {
    {"tallyvane", "tallyvane.db", "events", &SXRetentionPolicy::analytics},
    {"joulebook", "joulebook.db", "entries", &SXRetentionPolicy::powerLog},
    {"fernreporting", "fernreporting.db", "messages", &SXRetentionPolicy::spool},
};

constexpr double kSecondsPerDay = 86400;

// Seconds since the epoch a file counts from; nothing for a file that is not ours.
using FileTime = std::function<std::optional<double>(const fs::directory_entry&)>;

// A session summary: "<time stamp>-sonex-<host>-<service>.json", dated by its last write.
std::optional<double> SummaryFileTime(const fs::directory_entry& entry) {
  const std::string name = entry.path().filename().string();
  if (name.find("-sonex-") == std::string::npos || !name.ends_with(".json")) return std::nullopt;
  struct stat st {};
  if (::stat(entry.path().c_str(), &st) != 0) return std::nullopt;
  return static_cast<double>(st.st_mtim.tv_sec) + st.st_mtim.tv_nsec / 1e9;
}

// A damaged copy, "<store>.damaged-<yyyyMMdd-HHmmss>[-n][-wal|-shm]", dated by its name: the
// time it was moved aside (its own times are those of the store's last write).
std::optional<double> DamagedCopyTime(const fs::directory_entry& entry) {
  const std::string name = entry.path().filename().string();
  const size_t at = name.find(".damaged-");
  if (at == std::string::npos) return std::nullopt;
  std::tm utc{};
  int consumed = 0;
  if (std::sscanf(name.c_str() + at, ".damaged-%4d%2d%2d-%2d%2d%2d%n", &utc.tm_year, &utc.tm_mon,
                  &utc.tm_mday, &utc.tm_hour, &utc.tm_min, &utc.tm_sec, &consumed) != 6 ||
      consumed != 24) {
    return std::nullopt;
  }
  utc.tm_year -= 1900;
  utc.tm_mon -= 1;
  return static_cast<double>(::timegm(&utc));
}

// Removes the files of `dir` that `timeOf` dates and that are older than the limits allow, or
// beyond the newest `maxFiles`. Returns how many went; `error` says what could not.
uint64_t RemoveAgedFiles(const std::string& dir, const FileTime& timeOf,
                         const SXFileRetention& limits, double now, std::string& error) {
  std::vector<std::pair<double, fs::path>> files;
  std::error_code ec;
  for (fs::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
    std::error_code gone;  // a file removed meanwhile is skipped, not the rest of the listing
    if (!it->is_regular_file(gone)) continue;
    if (auto time = timeOf(*it)) files.emplace_back(*time, it->path());
  }
  if (ec && ec != std::errc::no_such_file_or_directory) {
    error = "cannot list " + dir + ": " + ec.message();
  }
  std::sort(files.begin(), files.end(), std::greater<>());  // newest first
  uint64_t removed = 0;
  for (size_t i = 0; i < files.size(); ++i) {
    const bool tooOld = now - files[i].first > limits.maxAgeDays * kSecondsPerDay;
    const bool tooMany = limits.maxFiles != 0 && i >= limits.maxFiles;
    if (!tooOld && !tooMany) continue;
    if (fs::remove(files[i].second, ec)) {
      ++removed;
    } else if (ec) {
      error = "cannot remove " + files[i].second.string() + ": " + ec.message();
    }
  }
  return removed;
}

std::chrono::nanoseconds Interval(double seconds) {
  // Beyond a year is as good as never, and keeps the conversion in range.
  return std::chrono::duration_cast<std::chrono::nanoseconds>(
      std::chrono::duration<double>(std::min(seconds, 365 * kSecondsPerDay)));
}

}  // namespace

std::shared_ptr<SXRetention> SXRetention::create(Options options, SXRetentionPolicy policy) {
  return std::shared_ptr<SXRetention>(new SXRetention(std::move(options), policy));
}

SXRetention::SXRetention(Options options, SXRetentionPolicy policy)
    : options_(std::move(options)),
      queue_(options_.dispatch->createSerialQueue("com.vendra.sonex.retention",
                                                  SXQualityOfService::kBackground)),
      policy_(policy) {
  options_.log = SXLogOrDiscard(std::move(options_.log));
  options_.pruning.cancelled = &stopped_;
  for (auto& bytes : storeBytes_) bytes = -1;
}

void SXRetention::start() {
  scheduleNext(std::min(Interval(policy().intervalSeconds),
                        std::chrono::nanoseconds(std::chrono::seconds(10))));
}

void SXRetention::stop() { stopped_ = true; }

void SXRetention::scheduleNext(std::chrono::nanoseconds delay) {
  if (stopped_) return;
  options_.dispatch->after(delay, queue_, [weak = weak_from_this()] {
    auto self = weak.lock();
    if (!self || self->stopped_) return;
    self->runPass();
    self->scheduleNext(Interval(self->policy().intervalSeconds));
  });
}

void SXRetention::setPolicy(const SXRetentionPolicy& policy) {
  SXMutexLock lock(policyMutex_);
  policy_ = policy;
}

SXRetentionPolicy SXRetention::policy() const {
  SXMutexLock lock(policyMutex_);
  return policy_;
}

void SXRetention::runPass() {
  SXMutexLock pass(passMutex_);
  const SXRetentionPolicy policy = this->policy();
  for (size_t i = 0; i < kStores && !stopped_; ++i) pruneStore(i, policy.*kPrunedStores[i].limits);
  if (!stopped_) ageOutFiles(policy);
}

void SXRetention::pruneStore(size_t index, const SXStoreRetention& limits) {
  const PrunedStore& store = kPrunedStores[index];
  const std::string path = options_.stateDir + "/" + store.file;
  std::error_code ec;
  if (!fs::exists(path, ec)) return;  // its adapter has not made it (yet)
  auto db = SXSqliteConnection::open(path, SXSqliteConnection::Mode::kReadWrite,
                                     kSXSqliteBusyTimeout, "");
  if (!db.ok()) return reportError(index, db.error());
  SXSqlitePruner pruner(**db, options_.pruning);
  const double cutoff = SXSqliteNow() - limits.maxAgeDays * kSecondsPerDay;
  uint64_t deleted = 0;
  SXStatus failed = pruner.deleteOlderThan(store.table, cutoff, "1", deleted);
  if (failed.ok() && index == kSpool) failed = pruneSpoolExtras(pruner, cutoff, **db, deleted);
  if (failed.ok()) failed = pruner.deleteToSize(store.table, limits.maxBytes, deleted);
  if (failed.ok()) failed = pruner.releaseFreePages();
  SXResult<uint64_t> used = failed.ok() ? (*db)->usedBytes() : SXResult<uint64_t>(failed);
  const uint64_t bytes = used.ok() ? *used : 0;
  failed = used.status();
  rowsPruned_[index] += deleted;
  if (failed.ok()) storeBytes_[index] = static_cast<int64_t>(bytes);
  if (deleted > 0) {
    SXLOG(*options_.log, nullptr, SXLogLevel::kDefault,
          "retention: pruned %llu rows of %s; it now holds %llu bytes",
          static_cast<unsigned long long>(deleted), path, static_cast<unsigned long long>(bytes));
  }
  reportError(index, failed.ok() ? "" : path + ": " + failed.error());
}

SXStatus SXRetention::pruneSpoolExtras(SXSqlitePruner& pruner, double cutoff,
                                       SXSqliteConnection& db, uint64_t& deleted) {
  if (spoolExported_.load()) {
    // The exporter makes its table when it first runs; until then it has taken nothing.
    SXResult<int64_t> hasCursor = db.queryInt(
        "SELECT COUNT(*) FROM sqlite_master WHERE type = 'table' AND name = 'otlp_export'", {});
    if (!hasCursor.ok()) return hasCursor.status();
    SXResult<int64_t> cursor = int64_t{0};
    if (*hasCursor != 0) {
      cursor = db.queryInt("SELECT last_message_id FROM otlp_export WHERE id = 1", {});
      if (!cursor.ok()) return cursor.status();
    }
    if (SXStatus failed = pruner.deleteThrough("messages", *cursor, deleted); !failed.ok()) {
      return failed;
    }
  }
  if (SXStatus failed = pruner.deleteOlderThan("flushes", cutoff, "1", deleted); !failed.ok()) {
    return failed;
  }
  // A session's row carries the info of its messages, so it stays while one refers to it: while
  // the id of its newest message is not below every id left (its other messages have lower ids).
  if (SXStatus failed = pruner.deleteOlderThan(
          "sessions", cutoff,
          "NOT EXISTS (SELECT 1 FROM session_refs WHERE session_id = sessions.id AND "
          "last_message_id >= (SELECT MIN(id) FROM messages))",
          deleted);
      !failed.ok()) {
    return failed;
  }
  return db.exec(
      "DELETE FROM session_refs WHERE NOT EXISTS "
      "(SELECT 1 FROM sessions WHERE sessions.id = session_refs.session_id)");
}

void SXRetention::ageOutFiles(const SXRetentionPolicy& policy) {
  const double now = SXSqliteNow();
  std::string error;
  uint64_t summaries =
      RemoveAgedFiles(options_.diagnosticLogsDir, SummaryFileTime, policy.summaryFiles, now, error);
  uint64_t copies =
      RemoveAgedFiles(options_.stateDir, DamagedCopyTime, policy.damagedCopies, now, error);
  summaryFilesRemoved_ += summaries;
  damagedCopiesRemoved_ += copies;
  if (summaries + copies > 0) {
    SXLOG(*options_.log, nullptr, SXLogLevel::kDefault,
          "retention: removed %llu summary files and %llu damaged store files",
          static_cast<unsigned long long>(summaries), static_cast<unsigned long long>(copies));
  }
  reportError(kStores, error);
}

void SXRetention::reportError(size_t slot, const std::string& error) {
  if (error == lastErrors_[slot]) return;
  lastErrors_[slot] = error;
  if (!error.empty()) {
    SXLOG(*options_.log, nullptr, SXLogLevel::kError, "retention: %s; trying again next pass",
          error);
  }
}

SXValue SXRetention::counters() const {
  SXValue rows = SXValue::object();
  for (size_t i = 0; i < kStores; ++i) rows[kPrunedStores[i].name] = rowsPruned_[i].load();
  return {{"rows_pruned", std::move(rows)},
          {"files_aged_out",
           {{"summary", summaryFilesRemoved_.load()}, {"damaged", damagedCopiesRemoved_.load()}}}};
}

SXValue SXRetention::gauges() const {
  SXValue bytes = SXValue::object();
  for (size_t i = 0; i < kStores; ++i) {
    if (int64_t measured = storeBytes_[i].load(); measured >= 0) {
      bytes[kPrunedStores[i].name] = measured;
    }
  }
  if (bytes.empty()) return SXValue::object();
  return {{"store_bytes", std::move(bytes)}};
}
