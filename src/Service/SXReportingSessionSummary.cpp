// A session's summary event and JSON file, and its orientation tracking.
#include <algorithm>
#include <cmath>
#include <ctime>

#include "SXReportingSession.h"
#include "Statistics/SXReportingUtility.h"
#include "common/SXServiceTypes.h"
#include "common/SXValueText.h"

namespace {

constexpr const char* kSummaryFunction = "-[SXReportingSession createSummaryEventForSession]";
constexpr const char* kOrientationFunction = "-[SXReportingSession start]_block_invoke";
constexpr const char* kSummaryKey = "SX_Session_Summary_Event";
constexpr SXReportingServiceType kTelephony = 2;
constexpr SXReportingServiceType kLongFormAudio = 7;
constexpr int64_t kDeviceClassWithoutOrientation = 6;

// The longest file name the file systems we run on take, in bytes.
constexpr size_t kMaxFileName = 255;
// Files of one name written in one second are told apart by "-2" up to this count; beyond it
// the summary's file is not written.
constexpr int kMaxSameNameFiles = 1000;

// A name as it stands inside a file name: unchanged, but for the two bytes no file name can
// hold, "/" and NUL, which become "_".
std::string fileNameComponent(std::string name) {
  std::replace_if(
      name.begin(), name.end(), [](char c) { return c == '/' || c == '\0'; }, '_');
  return name;
}

// `text` cut to at most `bytes` bytes, never inside a UTF-8 sequence.
std::string utf8Prefix(const std::string& text, size_t bytes) {
  if (text.size() <= bytes) return text;
  size_t cut = bytes;
  while (cut > 0 && (static_cast<unsigned char>(text[cut]) & 0xC0) == 0x80) --cut;
  return text.substr(0, cut);
}

// The summary file's name: "<stamp>-sonex-<host>-<type>.json", "-<n>" before ".json" for the
// n-th file of that name. A host name too long for the file system is shortened to fit.
std::string summaryFileName(const std::string& stamp, const std::string& host,
                            const std::string& type, int n) {
  std::string suffix = "-" + type + (n > 1 ? "-" + std::to_string(n) : "") + ".json";
  std::string head = stamp + "-sonex-";
  size_t room = kMaxFileName - std::min(kMaxFileName, head.size() + suffix.size());
  return head + utf8Prefix(host, room) + suffix;
}

// "yyyyMMdd-HHmmssZ" in the device's time zone, for example 20261116-185803+0000.
std::string summaryTimeStamp(SXDate now) {
  std::time_t t = std::chrono::system_clock::to_time_t(now);
  std::tm local{};
  localtime_r(&t, &local);
  char buf[32];
  std::strftime(buf, sizeof buf, "%Y%m%d-%H%M%S%z", &local);
  return buf;
}

}  // namespace

std::optional<SXValue> SXReportingSession::createSummaryEventForSession() {
  auto aggregate = aggregate_.load();
  if (!aggregate) return std::nullopt;

  // Each key's texts are joined as they come, so that the event is built with one copy of the
  // aggregate's text rather than two.
  std::map<std::string, std::string> joined;
  {
    SXMutexLock lock(aggregate->mutex);
    if (aggregate->entries.empty()) return std::nullopt;
    joined[kSummaryKey] = std::to_string(serviceType());
    for (const auto& entry : aggregate->entries) {
      entry.forEachText([&](const std::string& key, const std::string& text) {
        auto [it, fresh] = joined.try_emplace(key);
        if (!fresh) it->second += ',';
        it->second += text;
      });
    }
  }
  SXValue event = SXValue::object();
  for (auto& [key, text] : joined) event[key] = std::move(text);

  SXValue info = userInfo();
  {
    SXMutexLock lock(aggregate->mutex);
    aggregate->entries.insert(aggregate->entries.begin(), SXReportingAggregateEntry(info));
  }
  if (SXReportingUtilityIsInternalBuild(*environment_)) writeSummaryFile(aggregate, info);
  return event;
}

void SXReportingSession::writeSummaryFile(const std::shared_ptr<SXReportingAggregate>& aggregate,
                                          const SXValue& info) {
  SXValue list = SXValue::array();
  {
    SXMutexLock lock(aggregate->mutex);
    for (const auto& entry : aggregate->entries) list.push_back(entry.toValue());
  }
  std::string json;
  try {
    json = list.dump(2);
  } catch (const std::exception& e) {
    SXLOG_IN(kSummaryFunction, log(), scope(), SXLogLevel::kError, "dataWithJSONObject: %@",
             e.what());
    json = list.dump(2, ' ', false, SXValue::error_handler_t::replace);
  }

  const std::string& directory = environment_->platform().diagnosticLogsDirectory;
  SXFileSystem& fs = *environment_->platform().fileSystem;
  // The mode the platform asks for; the daemon's umask narrows it (0750). The write below
  // refuses a directory that is a symlink.
  if (SXStatus made = fs.createDirectory(directory, 0777); !made.ok()) {
    SXLOG_IN(kSummaryFunction, log(), scope(), SXLogLevel::kError,
             "can't create logging directory at %@: %@", directory, made.error());
  }
  auto host = info.find("HostApplicationDisplayID");
  std::string hostName = fileNameComponent(host != info.end() ? SXValueText(*host) : "unknown");
  std::string typeName = fileNameComponent(SXServiceTypeName(serviceType()));
  std::string stamp = summaryTimeStamp(environment_->platform().clock->now());
  // Sessions of one host and type that stop within the same second each keep their own file.
  for (int n = 1; n <= kMaxSameNameFiles; ++n) {
    std::string path = directory + "/" + summaryFileName(stamp, hostName, typeName, n);
    bool taken = false;
    SXStatus written = fs.writeNewFileAtomically(path, json, taken);
    if (taken) continue;
    if (!written.ok()) {
      SXLOG_IN(kSummaryFunction, log(), scope(), SXLogLevel::kError, "jsonOutput writeToURL: %@",
               written.error());
    }
    return;
  }
  SXLOG_IN(kSummaryFunction, log(), scope(), SXLogLevel::kError, "jsonOutput writeToURL: %@",
           SXFormat("%d files named %@ in one second", kMaxSameNameFiles,
                    summaryFileName(stamp, hostName, typeName, 1)));
}

bool SXReportingSession::shouldReportOrientation() {
  if (!SXReportingUtilityIsInternalBuild(*environment_)) return false;
  SXReportingServiceType type = serviceType();
  if (type != kLongFormAudio && type != kTelephony) return false;
  int64_t deviceClass = 0;
  if (auto value = environment_->platform().device->property("DeviceClassNumber");
      value && value->is_number()) {
    deviceClass = value->get<int64_t>();
  }
  return deviceClass != kDeviceClassWithoutOrientation;
}

void SXReportingSession::registerOrientationCallbacks() {
  std::string id = SXFormat("SXReportingService %lli", reporterID());
  {
    SXMutexLock lock(mutex_);
    orientationCallbackID_ = id;
    startDate_ = environment_->platform().clock->now();
  }
  auto& orientation = *environment_->platform().orientation;
  auto self = shared_from_this();
  orientation.registerDeviceOrientationCallback(id, [self](int32_t value) {
    self->recordOrientation("device", "device_orientation", "device_orientation_time", value);
  });
  orientation.registerInterfaceOrientationCallback(id, [self](int32_t value) {
    self->recordOrientation("ui", "ui_orientation", "ui_orientation_time", value);
  });
}

void SXReportingSession::unregisterOrientationCallbacks() {
  std::optional<std::string> id;
  {
    SXMutexLock lock(mutex_);
    id = std::exchange(orientationCallbackID_, std::nullopt);
  }
  if (!id) return;
  auto& orientation = *environment_->platform().orientation;
  orientation.unregisterDeviceOrientationCallback(*id);
  orientation.unregisterInterfaceOrientationCallback(*id);
}

void SXReportingSession::recordOrientation(const char* mode, const char* nameKey,
                                           const char* timeKey, int32_t orientation) {
  std::string name = environment_->platform().orientation->orientationName(orientation);
  SXDate now = environment_->platform().clock->now();
  SXDate since = startDate().value_or(now);
  // Milliseconds, halves away from zero.
  double time = std::round(SXSecondsBetween(since, now) * 1000.0) / 1000.0;
  SXValue info = userInfo();
  auto app = info.find("HostApplicationDisplayID");
  SXLOG_IN(kOrientationFunction, log(), scope(), SXLogLevel::kDebug,
           "Orientation handler callback mode=%s orientation=\"%@\" app=\"%@\", time=%@, id=\"%@\"",
           mode, name, app != info.end() ? *app : SXValue(), time, orientationCallbackID());
  appendToAggregate([&] {
    return SXReportingAggregateEntry(SXValue{{nameKey, name}, {timeKey, time}});
  });
}
