#include "sqlite/SqliteJoulebook.h"

namespace {

constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS entries(id INTEGER PRIMARY KEY, time REAL, client_id INTEGER, "
    "event TEXT, payload_json TEXT);"
    // Retention finds old rows by id; an index on time costs every insert.
    "DROP INDEX IF EXISTS entries_time";
constexpr const char* kInsert =
    "INSERT INTO entries(time, client_id, event, payload_json) VALUES (?1, ?2, ?3, ?4)";

}  // namespace

SXSqliteJoulebook::SXSqliteJoulebook(std::string dbPath, std::shared_ptr<SXLogFacility> log,
                                     std::chrono::milliseconds busyTimeout)
    : writer_({.path = std::move(dbPath),
               .schema = kSchema,
               .insertSql = kInsert,
               .rowNoun = "power-log entries",
               .threadName = "sxr-joulebook",
               .busyTimeout = busyTimeout},
              std::move(log)) {}

void SXSqliteJoulebook::logRegisteredEvent(int clientID, const std::string& event,
                                           const SXValue& entry, const std::optional<SXValue>&) {
  // The entry is copied here and serialised on the writer thread.
  writer_.enqueue([time = SXSqliteNow(), clientID, event, entry] {
    return SXSqliteRow{time, int64_t(clientID), event,
                       entry.dump(-1, ' ', false, SXValue::error_handler_t::replace)};
  });
}

void SXSqliteJoulebook::flush() { writer_.flush(); }
