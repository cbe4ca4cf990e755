#include "StoreRows.h"

#include <algorithm>
#include <filesystem>
#include <thread>

#include "sqlite/SqliteConnection.h"

StoreRows::StoreRows(std::string stateDir, std::string eventName, int64_t category, int64_t type)
    : stateDir_(std::move(stateDir)),
      eventName_(std::move(eventName)),
      category_(category),
      type_(type) {}

SXResult<int64_t> StoreRows::query(const std::string& db, const std::string& sql) const {
  std::string path = stateDir_ + "/" + db;
  if (!std::filesystem::exists(path)) return int64_t{0};  // nothing written yet
  auto connection =
      SXSqliteConnection::open(path, SXSqliteConnection::Mode::kReadOnly, kSXSqliteBusyTimeout, "");
  if (!connection.ok()) return connection.status();
  SXSqliteStatement statement;
  if (SXStatus failed = (*connection)->prepare(sql, statement); !failed.ok()) return failed;
  std::vector<SXValue> rows;
  if (SXStatus failed = statement.query({}, rows); !failed.ok()) return failed;
  if (rows.size() == 1 && rows[0]["n"].is_number_integer()) return rows[0]["n"].get<int64_t>();
  return int64_t{0};
}

SXStatus StoreRows::mark() {
  auto events = query("tallyvane.db", "SELECT coalesce(max(id), 0) AS n FROM events");
  if (!events.ok()) return events.status();
  auto messages = query("fernreporting.db", "SELECT coalesce(max(id), 0) AS n FROM messages");
  if (!messages.ok()) return messages.status();
  mark_ = {*events, *messages};
  return {};
}

SXResult<StoreCounts> StoreRows::count() const {
  // Names and numbers are the benchmark's own, never user text, so they go in as literals.
  auto events = query("tallyvane.db", "SELECT count(*) AS n FROM events WHERE id > " +
                                          std::to_string(mark_.tallyvane) + " AND name = '" +
                                          eventName_ + "'");
  if (!events.ok()) return events.status();
  auto messages = query("fernreporting.db", "SELECT count(*) AS n FROM messages WHERE id > " +
                                                std::to_string(mark_.fernReporting) +
                                                " AND category = " + std::to_string(category_) +
                                                " AND type = " + std::to_string(type_));
  if (!messages.ok()) return messages.status();
  return StoreCounts{*events, *messages};
}

StoreCounts StoreRows::waitFor(const StoreCounts& expected, std::chrono::milliseconds quiet,
                               std::string& error) const {
  StoreCounts counts;
  auto lastProgress = std::chrono::steady_clock::now();
  for (;;) {
    auto started = std::chrono::steady_clock::now();
    SXResult<StoreCounts> counted = count();
    if (!counted.ok()) {
      error = counted.error();
      return counts;
    }
    const StoreCounts& now = *counted;
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
