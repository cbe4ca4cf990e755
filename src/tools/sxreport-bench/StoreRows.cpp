#include "StoreRows.h"

#include <algorithm>
#include <filesystem>
#include <thread>

#include "platform/SqliteConnection.h"

StoreRows::StoreRows(std::string stateDir, std::string eventName, int64_t category, int64_t type)
    : stateDir_(std::move(stateDir)),
      eventName_(std::move(eventName)),
      category_(category),
      type_(type) {}

std::optional<std::string> StoreRows::query(const std::string& db, const std::string& sql,
                                            int64_t& value) const {
  value = 0;
  std::string path = stateDir_ + "/" + db;
  if (!std::filesystem::exists(path)) return std::nullopt;  // nothing written yet
  std::string error;
  auto connection = SXSqliteConnection::open(path, SXSqliteConnection::Mode::kReadOnly,
                                             kSXSqliteBusyTimeout, "", error);
  if (!connection) return error;
  SXSqliteStatement statement;
  if (auto failed = connection->prepare(sql, statement)) return *failed;
  std::vector<SXValue> rows;
  if (auto failed = statement.query({}, rows)) return *failed;
  if (rows.size() == 1 && rows[0]["n"].is_number_integer()) value = rows[0]["n"].get<int64_t>();
  return std::nullopt;
}

std::optional<std::string> StoreRows::mark() {
  if (auto failed =
          query("tallyvane.db", "SELECT coalesce(max(id), 0) AS n FROM events", mark_.tallyvane)) {
    return failed;
  }
  return query("fernreporting.db", "SELECT coalesce(max(id), 0) AS n FROM messages",
               mark_.fernReporting);
}

std::optional<std::string> StoreRows::count(StoreCounts& counts) const {
  // Names and numbers are the benchmark's own, never user text, so they go in as literals.
  std::string events = "SELECT count(*) AS n FROM events WHERE id > " +
                       std::to_string(mark_.tallyvane) + " AND name = '" + eventName_ + "'";
  if (auto failed = query("tallyvane.db", events, counts.tallyvane)) return failed;
  std::string messages =
      "SELECT count(*) AS n FROM messages WHERE id > " + std::to_string(mark_.fernReporting) +
      " AND category = " + std::to_string(category_) + " AND type = " + std::to_string(type_);
  return query("fernreporting.db", messages, counts.fernReporting);
}

StoreCounts StoreRows::waitFor(const StoreCounts& expected, std::chrono::milliseconds quiet,
                               std::string& error) const {
  StoreCounts counts;
  auto lastProgress = std::chrono::steady_clock::now();
  for (;;) {
    StoreCounts now;
    auto started = std::chrono::steady_clock::now();
    if (auto failed = count(now)) {
      error = *failed;
      return counts;
    }
    if (now.tallyvane != counts.tallyvane || now.fernReporting != counts.fernReporting) {
      lastProgress = std::chrono::steady_clock::now();
    }
    counts = now;
    if (counts.tallyvane >= expected.tallyvane && counts.fernReporting >= expected.fernReporting) {
      return counts;
    }
    if (std::chrono::steady_clock::now() - lastProgress > quiet) return counts;
    // Counting a large store is work the daemon's disk and CPU feel, so poll no more than a
    // fifth of the time.
    auto took = std::chrono::steady_clock::now() - started;
    std::this_thread::sleep_for(
        std::max<std::chrono::steady_clock::duration>(std::chrono::milliseconds(50), 4 * took));
  }
}
