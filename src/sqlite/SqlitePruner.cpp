#include "sqlite/SqlitePruner.h"

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

SXStatus SXSqlitePruner::deleteInChunks(const std::string& table, const std::string& condition,
                                        const std::string& order, const SXSqliteRow& params,
                                        int64_t maxRows, uint64_t& deleted) {
  const std::string limit = "?" + std::to_string(params.size() + 1);
  SXSqliteStatement statement;
  if (SXStatus failed =
          db_.prepare("DELETE FROM " + table + " WHERE id IN (SELECT id FROM " + table +
                          " WHERE (" + condition + ") AND id < (SELECT MAX(id) FROM " + table +
                          ") ORDER BY " + order + " LIMIT " + limit + ")",
                      statement);
      !failed.ok()) {
    return failed;
  }
  SXSqliteRow bound = params;
  bound.resize(params.size() + 1);  // the limit, set for each chunk
  while (maxRows > 0 && !cancelled()) {
    const int64_t chunk = std::min(maxRows, options_.chunkRows);
    bound.back() = chunk;
    const auto start = std::chrono::steady_clock::now();
    if (SXStatus failed = statement.run(bound); !failed.ok()) return failed;
    const int64_t changed = db_.changes();
    deleted += static_cast<uint64_t>(changed);
    maxRows -= changed;
    if (changed < chunk) break;
    pauseAfter(start);
  }
  return {};
}

SXStatus SXSqlitePruner::deleteOlderThan(const std::string& table, double cutoff,
                                         const std::string& condition, uint64_t& deleted) {
  // No index on time: every insert would pay for it. Rows are appended as they happen, so the
  // old ones are a table's first: walk it by id a chunk at a time, deleting what is old, and
  // stop at the first chunk that holds nothing older than the cutoff.
  SXSqliteStatement scan;
  SXSqliteStatement remove;
  const std::string chunk = "SELECT id, time FROM " + table +
                            " WHERE id > ?1 AND id < (SELECT MAX(id) FROM " + table +
                            ") ORDER BY id LIMIT ?3";
  SXStatus prepared =
      db_.prepare("SELECT MAX(id) AS last, TOTAL(time < ?2) AS old FROM (" + chunk + ")", scan);
  if (prepared.ok()) {
    prepared = db_.prepare("DELETE FROM " + table + " WHERE id > ?1 AND id <= ?2 AND " +
                               "time < ?3 AND (" + condition + ")",
                           remove);
  }
  if (!prepared.ok()) return prepared;
  int64_t after = std::numeric_limits<int64_t>::min();
  while (!cancelled()) {
    const auto start = std::chrono::steady_clock::now();
    std::vector<SXValue> rows;
    if (SXStatus failed = scan.query({after, cutoff, options_.chunkRows}, rows); !failed.ok()) {
      return failed;
    }
    if (rows.empty() || !rows[0]["last"].is_number_integer()) break;  // no row left to look at
    const auto last = rows[0]["last"].get<int64_t>();
    if (SXStatus failed = remove.run({after, last, cutoff}); !failed.ok()) return failed;
    deleted += static_cast<uint64_t>(db_.changes());
    if (rows[0]["old"].get<double>() == 0) break;
    after = last;
    pauseAfter(start);
  }
  return {};
}

SXStatus SXSqlitePruner::deleteThrough(const std::string& table, int64_t lastId,
                                       uint64_t& deleted) {
  return deleteInChunks(table, "id <= ?1", "id", {lastId}, kAllRows, deleted);
}

SXStatus SXSqlitePruner::deleteToSize(const std::string& table, uint64_t maxBytes,
                                      uint64_t& deleted) {
  // Only rows that were there when it began: a writer faster than the pruning must not keep it
  // going for ever.
  SXResult<int64_t> last = db_.queryInt("SELECT MAX(id) FROM " + table, {});
  if (!last.ok()) return last.status();
  for (;;) {
    SXResult<uint64_t> usedBytes = db_.usedBytes();
    if (!usedBytes.ok()) return usedBytes.status();
    const uint64_t used = *usedBytes;
    if (used <= maxBytes || cancelled()) return {};
    SXResult<int64_t> span = db_.queryInt("SELECT MAX(id) - MIN(id) + 1 FROM " + table, {});
    if (!span.ok()) return span.status();
    // As many rows as the excess holds at the table's mean row size (which counts its indexes
    // and the other tables too, so it errs towards deleting too few; the loop goes on).
    const uint64_t perRow =
        std::max<uint64_t>(1, used / static_cast<uint64_t>(std::max<int64_t>(*span, 1)));
    const auto rows = static_cast<int64_t>((used - maxBytes + perRow - 1) / perRow);
    const uint64_t before = deleted;
    const auto start = std::chrono::steady_clock::now();
    if (SXStatus failed = deleteInChunks(table, "id <= ?1", "id", {*last},
                                         std::min(rows, options_.chunkRows), deleted);
        !failed.ok()) {
      return failed;
    }
    if (deleted == before) return {};  // nothing older is left
    pauseAfter(start);
  }
}

SXStatus SXSqlitePruner::releaseFreePages() {
  for (;;) {
    SXResult<int64_t> free = db_.queryInt("PRAGMA freelist_count", {});
    if (!free.ok()) return free.status();
    if (*free == 0 || cancelled()) break;
    const auto start = std::chrono::steady_clock::now();
    const int64_t pages = std::min(*free, options_.vacuumPages);
    if (SXStatus failed = db_.exec("PRAGMA incremental_vacuum(" + std::to_string(pages) + ")");
        !failed.ok()) {
      return failed;
    }
    SXResult<int64_t> left = db_.queryInt("PRAGMA freelist_count", {});
    if (!left.ok()) return left.status();
    if (*left >= *free) break;  // a store made without incremental auto-vacuum keeps its pages
    pauseAfter(start);
  }
  return db_.exec("PRAGMA wal_checkpoint(PASSIVE)");
}
