#include "sqlite/SqliteTallyvane.h"

#include <unordered_map>

namespace {

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL, name TEXT, "
    "payload_json TEXT);"
    // Retention finds old rows by id; an index on time costs every insert.
    "DROP INDEX IF EXISTS events_time";
constexpr const char* kInsert = "INSERT INTO events(time, name, payload_json) VALUES (?1, ?2, ?3)";

// The newest `limit` matches, put back in ascending order.
constexpr const char* kSelect =
    "SELECT id, time, name, payload_json FROM (SELECT * FROM events "
    "WHERE (?1 IS NULL OR name GLOB ?1) AND (?3 IS NULL OR time >= ?3) "
    "ORDER BY id DESC LIMIT ?2) ORDER BY id";

// Event names repeat (one per category and type): each caller thread keeps one copy of each,
// which its rows share instead of copying the name into every row.
std::shared_ptr<const std::string> SharedName(const std::string& name) {
  constexpr size_t kMaxNames = 1024;
  thread_local std::unordered_map<std::string, std::shared_ptr<const std::string>> names;
  if (auto it = names.find(name); it != names.end()) return it->second;
  if (names.size() >= kMaxNames) names.clear();
  return names.emplace(name, std::make_shared<const std::string>(name)).first->second;
}

}  // namespace

SXSqliteTallyvane::SXSqliteTallyvane(std::string dbPath, std::shared_ptr<SXLogFacility> log,
                                     std::chrono::milliseconds busyTimeout)
    : writer_({.path = std::move(dbPath),
               .schema = kSchema,
               .insertSql = kInsert,
               .rowNoun = "events",
               .threadName = "sxr-tallyvane",
               .busyTimeout = busyTimeout},
              std::move(log)) {}

bool SXSqliteTallyvane::sendEventLazy(const std::string& name, SXPayloadProvider provider) {
  return writer_.enqueue([time = SXSqliteNow(), name, provider = std::move(provider)] {
    SXValue payload = provider ? provider() : SXValue();
    return SXSqliteRow{time, name, payload.dump(-1, ' ', false, SXValue::error_handler_t::replace)};
  });
}

bool SXSqliteTallyvane::sendEventLazy(const std::string& name, SXPayloadProvider provider,
                                      SXPayloadTextProvider json) {
  if (!json) return sendEventLazy(name, std::move(provider));
  return writer_.enqueue([time = SXSqliteNow(), name = SharedName(name), json = std::move(json)] {
    return SXSqliteRow{time, name, json()};
  });
}

void SXSqliteTallyvane::flush() { writer_.flush(); }

SXResult<std::vector<SXValue>> SXSqliteTallyvane::readEvents(const std::string& dbPath,
                                                             std::optional<std::string> nameFilter,
                                                             int64_t limit,
                                                             std::optional<double> since) {
  auto db = SXSqliteConnection::open(dbPath, SXSqliteConnection::Mode::kReadOnly,
                                     kSXSqliteBusyTimeout, "");
  if (!db.ok()) return db.status();
  SXSqliteStatement select;
  std::vector<SXValue> rows;
  if (SXStatus failed = (*db)->prepare(kSelect, select); !failed.ok()) {
    return SXFailure(dbPath + ": " + failed.error());
  }
  SXSqliteField filter = nullptr;
  if (nameFilter) filter = *nameFilter;
  SXSqliteField from = nullptr;
  if (since) from = *since;
  if (SXStatus failed = select.query({filter, limit > 0 ? limit : int64_t(-1), from}, rows);
      !failed.ok()) {
    return SXFailure(dbPath + ": " + failed.error());
  }
  for (SXValue& row : rows) {
    SXValue& stored = row["payload_json"];
    SXValue payload = stored.is_string()
                          ? SXValue::parse(stored.get_ref<const std::string&>(), nullptr, false)
                          : SXValue();
    row["payload"] = payload.is_discarded() ? stored : payload;
    row.erase("payload_json");
  }
  return rows;
}

std::vector<SXValue> SXSqliteTallyvane::readEvents(const std::string& dbPath,
                                                   std::optional<std::string> nameFilter,
                                                   int64_t limit) {
  auto rows = readEvents(dbPath, std::move(nameFilter), limit, std::nullopt);
  return rows.ok() ? std::move(*rows) : std::vector<SXValue>{};
}
