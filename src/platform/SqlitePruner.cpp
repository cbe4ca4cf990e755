#include "platform/SqlitePruner.h"

#include <algorithm>
#include <limits>
#include <thread>

namespace {

constexpr int64_t kAllRows = std::numeric_limits<int64_t>::max();

}  // namespace

void SXSqlitePruner::pauseAfter(std::chrono::steady_clock::time_point start) const {
  auto took = std::chrono::steady_clock::now() - start;
  std::this_thread::sleep_for(std::max<std::chrono::steady_clock::duration>(took, options_.pause));
}

std::optional<std::string> SXSqlitePruner::deleteInChunks(const std::string& table,
                                                          const std::string& condition,
                                                          const std::string& order,
                                                          const SXSqliteRow& params,
                                                          int64_t maxRows, uint64_t& deleted) {
  const std::string limit = "?" + std::to_string(params.size() + 1);
  SXSqliteStatement statement;
  if (auto failed = db_.prepare("DELETE FROM " + table + " WHERE id IN (SELECT id FROM " + table +
                                    " WHERE (" + condition + ") AND id < (SELECT MAX(id) FROM " +
                                    table + ") ORDER BY " + order + " LIMIT " + limit + ")",
                                statement)) {
    return failed;
  }
  SXSqliteRow bound = params;
  bound.resize(params.size() + 1);  // the limit, set for each chunk
  while (maxRows > 0 && !cancelled()) {
    const int64_t chunk = std::min(maxRows, options_.chunkRows);
    bound.back() = chunk;
    const auto start = std::chrono::steady_clock::now();
    if (auto failed = statement.run(bound)) return failed;
    const int64_t changed = db_.changes();
    deleted += static_cast<uint64_t>(changed);
    maxRows -= changed;
    if (changed < chunk) break;
    pauseAfter(start);
  }
  return std::nullopt;
}

std::optional<std::string> SXSqlitePruner::deleteOlderThan(const std::string& table, double cutoff,
                                                           const std::string& condition,
                                                           uint64_t& deleted) {
  // No index on time: every insert would pay for it. Rows are appended as they happen, so the
  // old ones are a table's first: walk it by id a chunk at a time, deleting what is old, and
  // stop at the first chunk that holds nothing older than the cutoff.
  SXSqliteStatement scan;
  SXSqliteStatement remove;
  if (auto failed = db_.prepare("SELECT MAX(id) AS last, TOTAL(time < ?2) AS old FROM (SELECT id, "
                                "time FROM " + table + " WHERE id > ?1 AND id < (SELECT MAX(id) "
                                "FROM " + table + ") ORDER BY id LIMIT ?3)",
                                scan)) {
    return failed;
  }
  if (auto failed = db_.prepare("DELETE FROM " + table + " WHERE id > ?1 AND id <= ?2 AND " +
                                    "time < ?3 AND (" + condition + ")",
                                remove)) {
    return failed;
  }
  int64_t after = std::numeric_limits<int64_t>::min();
  while (!cancelled()) {
    const auto start = std::chrono::steady_clock::now();
    std::vector<SXValue> rows;
    if (auto failed = scan.query({after, cutoff, options_.chunkRows}, rows)) return failed;
    if (rows.empty() || !rows[0]["last"].is_number_integer()) break;  // no row left to look at
    const auto last = rows[0]["last"].get<int64_t>();
    if (auto failed = remove.run({after, last, cutoff})) return failed;
    deleted += static_cast<uint64_t>(db_.changes());
    if (rows[0]["old"].get<double>() == 0) break;
    after = last;
    pauseAfter(start);
  }
  return std::nullopt;
}

std::optional<std::string> SXSqlitePruner::deleteThrough(const std::string& table, int64_t lastId,
                                                         uint64_t& deleted) {
  return deleteInChunks(table, "id <= ?1", "id", {lastId}, kAllRows, deleted);
}

std::optional<std::string> SXSqlitePruner::deleteToSize(const std::string& table, uint64_t maxBytes,
                                                        uint64_t& deleted) {
  // Only rows that were there when it began: a writer faster than the pruning must not keep it
  // going for ever.
  int64_t last = 0;
  if (auto failed = db_.queryInt("SELECT MAX(id) FROM " + table, {}, last)) return failed;
  for (;;) {
    uint64_t used = 0;
    int64_t span = 0;
    if (auto failed = db_.usedBytes(used)) return failed;
    if (used <= maxBytes || cancelled()) return std::nullopt;
    if (auto failed = db_.queryInt("SELECT MAX(id) - MIN(id) + 1 FROM " + table, {}, span)) {
      return failed;
    }
    // As many rows as the excess holds at the table's mean row size (which counts its indexes
    // and the other tables too, so it errs towards deleting too few; the loop goes on).
    const uint64_t perRow =
        std::max<uint64_t>(1, used / static_cast<uint64_t>(std::max<int64_t>(span, 1)));
    const auto rows = static_cast<int64_t>((used - maxBytes + perRow - 1) / perRow);
    const uint64_t before = deleted;
    const auto start = std::chrono::steady_clock::now();
    if (auto failed = deleteInChunks(table, "id <= ?1", "id", {last},
                                     std::min(rows, options_.chunkRows), deleted)) {
      return failed;
    }
    if (deleted == before) return std::nullopt;  // nothing older is left
    pauseAfter(start);
  }
}

std::optional<std::string> SXSqlitePruner::releaseFreePages() {
  for (;;) {
    int64_t free = 0;
    if (auto failed = db_.queryInt("PRAGMA freelist_count", {}, free)) return failed;
    if (free == 0 || cancelled()) break;
    const auto start = std::chrono::steady_clock::now();
    const int64_t pages = std::min(free, options_.vacuumPages);
    if (auto failed = db_.exec("PRAGMA incremental_vacuum(" + std::to_string(pages) + ")")) {
      return failed;
    }
    int64_t left = 0;
    if (auto failed = db_.queryInt("PRAGMA freelist_count", {}, left)) return failed;
    if (left >= free) break;  // a store made without incremental auto-vacuum keeps its pages
    pauseAfter(start);
  }
  return db_.exec("PRAGMA wal_checkpoint(PASSIVE)");
}
