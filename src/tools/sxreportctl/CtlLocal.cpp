#include "CtlLocal.h"

#include <cstdio>
#include <ctime>
#include <filesystem>
#include <iostream>
#include <memory>

#include "common/SXValueText.h"
#include "linux/InotifyNotifications.h"
#include "linux/JsonPreferences.h"
#include "platform/DiscardLog.h"
#include "sqlite/SqliteConnection.h"
#include "sqlite/SqliteTallyvane.h"

namespace fs = std::filesystem;

namespace {

int fail(const std::string& message) {
  std::cerr << message << "\n";
  return kSXCtlLocalError;
}

std::string jsonText(const SXValue& value, int indent = -1) {
  return value.dump(indent, ' ', false, SXValue::error_handler_t::replace);
}

void printEvent(const SXValue& event) {
  const SXValue& payload = event.at("payload");
  // A payload that does not parse as JSON is shown as it was stored.
  const std::string text = payload.is_string() ? payload.get<std::string>() : jsonText(payload);
  std::printf("%lld  %.3f  %s  %s\n", static_cast<long long>(event.at("id").get<int64_t>()),
              event.at("time").get<double>(), event.at("name").get<std::string>().c_str(),
              text.c_str());
}

}  // namespace

int SXCtlRunEvents(const SXCtlRequest& r, const SXPaths& paths) {
  const std::string path = paths.stateDir + "/tallyvane.db";
  if (!fs::exists(path)) return fail("events: no analytics store at " + path);
  auto events = SXSqliteTallyvane::readEvents(path, r.eventName, r.limit.value_or(0), r.since);
  if (!events.ok()) return fail("events: cannot read " + events.error());
  if (r.json) {
    std::cout << jsonText(SXValue(std::move(*events))) << "\n";
  } else if (events->empty()) {
    std::cout << "(none)\n";
  } else {
    for (const SXValue& event : *events) printEvent(event);
  }
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
// "walBytes"}.
SXResult<SXValue> measureStore(const std::string& dir, const StoreFile& store) {
  const std::string path = dir + "/" + store.file;
  auto db = SXSqliteConnection::open(path, SXSqliteConnection::Mode::kReadOnly,
                                     std::chrono::seconds(2), "");
  if (!db.ok()) return db.status();
  SXSqliteStatement statement;
  std::vector<SXValue> rows;
  const std::string table = store.table;
  SXStatus failed =
      (*db)->prepare("SELECT COUNT(*) AS rows, MIN(time) AS oldest FROM " + table, statement);
  if (failed.ok()) failed = statement.query({}, rows);
  SXResult<uint64_t> used = failed.ok() ? (*db)->usedBytes() : SXResult<uint64_t>(failed);
  if (!used.ok()) return SXFailure(path + ": " + used.error());
  return SXValue{{"store", store.file},
                 {"rows", rows.at(0)["rows"]},
                 {"oldest", rows.at(0)["oldest"]},
                 {"usedBytes", *used},
                 {"fileBytes", fileBytes(path)},
                 {"walBytes", fileBytes(path + "-wal")}};
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
    SXResult<SXValue> measured = measureStore(paths.stateDir, store);
    if (!measured.ok()) return fail("sizes: " + measured.error());
    if (!r.json) printStore(*measured);
    all.push_back(std::move(*measured));
  }
  if (r.json) std::cout << jsonText(all) << "\n";
  if (!r.json && all.empty()) std::cout << "(no stores in " << paths.stateDir << ")\n";
  return 0;
}

// ---- defaults

namespace {

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

// Prints the preferences adapter's error lines as ours and remembers that there were some.
class ErrorCountingLog final : public SXLogFacility {
 public:
  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override {
    return std::make_shared<const SXLogScope>(scope);
  }
  bool isEnabled(const SXLogScope*, int level) const override {
    return level == static_cast<int>(SXLogLevel::kError);
  }
  void write(const SXLogScope*, SXLogLevel level, std::string_view line) override {
    if (level != SXLogLevel::kError) return;
    ++errors_;
    std::cerr << "defaults: " << line << "\n";
  }
  size_t errors() const { return errors_; }

 private:
  size_t errors_ = 0;
};

}  // namespace

int SXCtlRunDefaults(const SXCtlRequest& r, const SXPaths& paths) {
  if (r.defaultsAction == "read") {
    auto log = std::make_shared<ErrorCountingLog>();
    SXValue domain =
        SXJsonPreferences(paths.preferencesDirectory(), log).copyDomain(kSXCtlPreferencesDomain);
    return log->errors() ? kSXCtlLocalError : readDefaults(r, domain);
  }
  // A write's failure comes back as its reply; the lines the adapter logs would repeat it.
  SXJsonPreferences preferences(paths.preferencesDirectory(), std::make_shared<SXDiscardLog>());
  std::optional<SXValue> value;
  if (r.defaultsAction == "write") value = r.value;
  if (SXStatus set = preferences.setValue(kSXCtlPreferencesDomain, *r.key, value); !set.ok()) {
    return fail("defaults: " + set.error());
  }
  return 0;
}

int SXCtlRunNotify(const SXCtlRequest& r, const SXPaths& paths) {
  if (SXStatus posted = SXInotifyNotifications::postIn(paths.runtimeDir, r.notificationName);
      !posted.ok()) {
    return fail("notify: " + posted.error());
  }
  return 0;
}
