#include "CtlLocal.h"

#include <fcntl.h>
#include <sqlite3.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <memory>
#include <sstream>

#include "common/SXValueText.h"
#include "platform/SqliteConnection.h"

namespace fs = std::filesystem;

namespace {

int fail(const std::string& message) {
  std::cerr << message << "\n";
  return kSXCtlLocalError;
}

std::string jsonText(const SXValue& value, int indent = -1) {
  return value.dump(indent, ' ', false, SXValue::error_handler_t::replace);
}

std::string columnText(sqlite3_stmt* statement, int column) {
  const auto* text = sqlite3_column_text(statement, column);
  return text ? reinterpret_cast<const char*>(text) : "(null)";
}

// The newest `limit` events (all when no limit) of the name and time asked for, oldest first.
std::string eventsQuery(const SXCtlRequest& r) {
  std::string where = r.eventName && r.since ? " WHERE name = ?1 AND time >= ?2"
                      : r.eventName          ? " WHERE name = ?1"
                      : r.since              ? " WHERE time >= ?2"
                                             : "";
  return "SELECT id, time, name, payload_json FROM (SELECT * FROM events" + where +
         " ORDER BY id DESC" + (r.limit ? " LIMIT " + std::to_string(*r.limit) : "") +
         ") ORDER BY id";
}

void printEvent(sqlite3_stmt* statement, bool json, SXValue& all) {
  const int64_t id = sqlite3_column_int64(statement, 0);
  const double time = sqlite3_column_double(statement, 1);
  const std::string name = columnText(statement, 2);
  const std::string payload = columnText(statement, 3);
  if (json) {
    SXValue parsed = SXValue::parse(payload, nullptr, false);
    all.push_back({{"id", id},
                   {"time", time},
                   {"name", name},
                   {"payload", parsed.is_discarded() ? SXValue(payload) : parsed}});
    return;
  }
  std::printf("%lld  %.3f  %s  %s\n", static_cast<long long>(id), time, name.c_str(),
              payload.c_str());
}

}  // namespace

int SXCtlRunEvents(const SXCtlRequest& r, const SXPaths& paths) {
  const std::string path = paths.stateDir + "/tallyvane.db";
  if (!fs::exists(path)) return fail("events: no analytics store at " + path);
  sqlite3* raw = nullptr;
  int rc = sqlite3_open_v2(path.c_str(), &raw, SQLITE_OPEN_READONLY, nullptr);
  std::unique_ptr<sqlite3, decltype(&sqlite3_close)> db(raw, sqlite3_close);
  if (rc != SQLITE_OK) return fail("events: cannot open " + path + ": " + sqlite3_errmsg(raw));
  sqlite3_busy_timeout(db.get(), 2000);

  sqlite3_stmt* statementRaw = nullptr;
  rc = sqlite3_prepare_v2(db.get(), eventsQuery(r).c_str(), -1, &statementRaw, nullptr);
  std::unique_ptr<sqlite3_stmt, decltype(&sqlite3_finalize)> statement(statementRaw,
                                                                       sqlite3_finalize);
  if (rc != SQLITE_OK) return fail("events: cannot read " + path + ": " + sqlite3_errmsg(raw));
  if (r.eventName) {
    sqlite3_bind_text(statement.get(), 1, r.eventName->c_str(), -1, SQLITE_TRANSIENT);
  }
  if (r.since) sqlite3_bind_double(statement.get(), 2, *r.since);
  SXValue all = SXValue::array();
  size_t count = 0;
  while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
    printEvent(statement.get(), r.json, all);
    ++count;
  }
  if (rc != SQLITE_DONE) return fail("events: cannot read " + path + ": " + sqlite3_errmsg(raw));
  if (r.json) std::cout << jsonText(all) << "\n";
  if (!r.json && count == 0) std::cout << "(none)\n";
  return 0;
}

// ---- sizes

namespace {

struct StoreFile {
  const char* file;
  const char* table;  // the one that grows
};

constexpr StoreFile kStoreFiles[] = {
    {"tallyvane.db", "events"}, {"joulebook.db", "entries"}, {"fernreporting.db", "messages"}};

uint64_t fileBytes(const std::string& path) {
  std::error_code ec;
  const uintmax_t bytes = fs::file_size(path, ec);
  return ec ? 0 : bytes;
}

// {"store", "rows", "oldest" (seconds since the epoch, or null), "usedBytes", "fileBytes",
// "walBytes"}, or an error.
std::optional<std::string> measureStore(const std::string& dir, const StoreFile& store,
                                        SXValue& out) {
  const std::string path = dir + "/" + store.file;
  std::string error;
  auto db = SXSqliteConnection::open(path, SXSqliteConnection::Mode::kReadOnly,
                                     std::chrono::seconds(2), "", error);
  if (!db) return error;
  SXSqliteStatement statement;
  std::vector<SXValue> rows;
  uint64_t used = 0;
  const std::string table = store.table;
  if (auto failed =
          db->prepare("SELECT COUNT(*) AS rows, MIN(time) AS oldest FROM " + table, statement)) {
    return path + ": " + *failed;
  }
  if (auto failed = statement.query({}, rows)) return path + ": " + *failed;
  if (auto failed = db->usedBytes(used)) return path + ": " + *failed;
  out = {{"store", store.file},
         {"rows", rows.at(0)["rows"]},
         {"oldest", rows.at(0)["oldest"]},
         {"usedBytes", used},
         {"fileBytes", fileBytes(path)},
         {"walBytes", fileBytes(path + "-wal")}};
  return std::nullopt;
}

std::string bytesText(uint64_t bytes) {
  char text[32];
  if (bytes < 1024) return std::to_string(bytes) + " B";
  const char* unit = bytes < (1u << 20) ? "KiB" : bytes < (1u << 30) ? "MiB" : "GiB";
  const double scale = bytes < (1u << 20) ? 1024.0 : bytes < (1u << 30) ? 1048576.0 : 1073741824.0;
  std::snprintf(text, sizeof text, "%.1f %s", bytes / scale, unit);
  return text;
}

std::string utcText(const SXValue& seconds) {
  if (!seconds.is_number()) return "-";
  const std::time_t time = static_cast<std::time_t>(seconds.get<double>());
  std::tm utc{};
  gmtime_r(&time, &utc);
  char text[32];
  std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &utc);
  return text;
}

void printStore(const SXValue& store) {
  auto bytes = [&](const char* key) { return bytesText(store.at(key).get<uint64_t>()); };
  std::printf("%-17s %10llu rows  oldest %-20s  in use %-9s  file %-9s  log %s\n",
              store.at("store").get<std::string>().c_str(),
              store.at("rows").get<unsigned long long>(), utcText(store.at("oldest")).c_str(),
              bytes("usedBytes").c_str(), bytes("fileBytes").c_str(), bytes("walBytes").c_str());
}

}  // namespace

int SXCtlRunSizes(const SXCtlRequest& r, const SXPaths& paths) {
  SXValue all = SXValue::array();
  for (const StoreFile& store : kStoreFiles) {
    const std::string path = paths.stateDir + "/" + store.file;
    if (!fs::exists(path)) continue;
    SXValue measured;
    if (auto failed = measureStore(paths.stateDir, store, measured)) {
      return fail("sizes: " + *failed);
    }
    if (!r.json) printStore(measured);
    all.push_back(std::move(measured));
  }
  if (r.json) std::cout << jsonText(all) << "\n";
  if (!r.json && all.empty()) std::cout << "(no stores in " << paths.stateDir << ")\n";
  return 0;
}

// ---- defaults

namespace {

std::string domainPath(const SXPaths& paths) {
  return paths.preferencesDirectory() + "/" + kSXCtlPreferencesDomain + ".json";
}

// The stored domain; an absent file is an empty domain.
bool loadDomain(const std::string& path, SXValue& domain, std::string& error) {
  std::ifstream in(path);
  if (!in) {
    domain = SXValue::object();
    if (!fs::exists(path)) return true;
    error = "cannot read " + path + ": " + std::strerror(errno);
    return false;
  }
  std::stringstream text;
  text << in.rdbuf();
  domain = SXValue::parse(text.str(), nullptr, false);
  if (!domain.is_object()) {
    error = path + " does not hold a JSON object; not touching it";
    return false;
  }
  return true;
}

// Writes a temporary file beside the domain's file and renames it over, so that a reader
// never sees half a file.
bool storeDomain(const std::string& path, const SXValue& domain, std::string& error) {
  std::error_code ec;
  fs::create_directories(fs::path(path).parent_path(), ec);
  const std::string temp = path + ".tmp." + std::to_string(::getpid());
  {
    std::ofstream out(temp, std::ios::trunc);
    out << domain.dump(2, ' ', false, SXValue::error_handler_t::replace) << "\n";
    out.flush();
    if (!out) {
      error = "cannot write " + temp + ": " + std::strerror(errno);
      fs::remove(temp, ec);
      return false;
    }
  }
  if (std::rename(temp.c_str(), path.c_str()) != 0) {
    error = "cannot replace " + path + ": " + std::strerror(errno);
    fs::remove(temp, ec);
    return false;
  }
  return true;
}

int readDefaults(const SXCtlRequest& r, const SXValue& domain) {
  if (!r.key) {
    std::cout << jsonText(domain, r.json ? -1 : 2) << "\n";
    return 0;
  }
  auto it = domain.find(*r.key);
  if (it == domain.end()) {
    std::cerr << "defaults: " << kSXCtlPreferencesDomain << " has no value for " << *r.key << "\n";
    return kSXCtlNotSet;
  }
  std::cout << (r.json ? jsonText(*it) : SXValueText(*it)) << "\n";
  return 0;
}

}  // namespace

int SXCtlRunDefaults(const SXCtlRequest& r, const SXPaths& paths) {
  const std::string path = domainPath(paths);
  SXValue domain;
  std::string error;
  if (!loadDomain(path, domain, error)) return fail("defaults: " + error);
  if (r.defaultsAction == "read") return readDefaults(r, domain);
  if (r.defaultsAction == "write") {
    domain[*r.key] = r.value;
  } else if (domain.erase(*r.key) == 0) {
    return 0;  // nothing to delete
  }
  if (!storeDomain(path, domain, error)) return fail("defaults: " + error);
  return 0;
}

int SXCtlRunNotify(const SXCtlRequest& r, const SXPaths& paths) {
  const fs::path dir = fs::path(paths.runtimeDir) / "notify";
  std::error_code ec;
  fs::create_directories(dir, ec);
  const std::string path = (dir / r.notificationName).string();
  // Watchers wait for a close after writing, so the file is written, not just opened.
  const int fd = ::open(path.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644);
  if (fd < 0) return fail("notify: cannot open " + path + ": " + std::strerror(errno));
  const bool written = ::write(fd, "1", 1) == 1;
  const int writeErrno = errno;
  ::close(fd);
  if (!written) return fail("notify: cannot write " + path + ": " + std::strerror(writeErrno));
  return 0;
}
