#include "SXReportingUtility.h"

#include <array>
#include <chrono>

#include "SXReportingEnvironment.h"

namespace {

const std::array<std::string, 12> kCategoryNames = {
    "Undefined",     "Generic",     "Record", "Playback",     "PlaybackAndRecord", "Setup",
    "ClientRequest", "RouteChange", "Error",  "KestrelStats", "Performance",       "Volume"};

const std::array<std::string, 6> kTypeNames = {"Generic", "Start", "Stop",
                                               "Setup",   "Error", "IssueDetector"};

const char* componentName(uint32_t upperMask) {
  switch (upperMask) {
    case 0x08000000:
      return "Session";
    case 0x10000000:
      return "DSP";
    case 0x20000000:
      return "HAL";
    case 0x40000000:
      return "Routing";
    case 0x80000000:
      return "Kitbench";
    default:
      return "";
  }
}

}  // namespace

std::string SXReportingUtilityCategoryName(SXReportingCategory category) {
  std::string name;
  if (category >= 0x10000 && category != 0xFFFFFFFF) {
    name += componentName(category & 0xFFFF0000u);
    name += '_';
  }
  uint32_t proper = category & 0xFFFF;
  name += proper < kCategoryNames.size() ? kCategoryNames[proper] : kCategoryNames[0];
  return name;
}

const std::string& SXReportingUtilityTypeName(SXReportingMessageType type) {
  static const std::string kUnknown = "Unknown";
  static const std::string kUndefined = "Undefined";
  if (type < kTypeNames.size()) return kTypeNames[type];
  return type == 0xFFFF ? kUnknown : kUndefined;
}

const std::string& SXReportingUtilityMessageKind(SXReportingCategory category,
                                                 SXReportingMessageType type) {
  thread_local SXReportingPairNameCache cache;
  return cache.get(category, type, [&] {
    return SXReportingUtilityCategoryName(category) + "_" + SXReportingUtilityTypeName(type);
  });
}

SXValue SXReportingUtilityHostApplicationName(const SXValue* configuration) {
  if (configuration && configuration->is_object()) {
    auto it = configuration->find("HostApplicationDisplayID");
    if (it != configuration->end()) return *it;
  }
  return "Unknown";
}

bool SXReportingUtilityIsInternalBuild(SXReportingEnvironment& environment) {
  return environment.isInternalBuild();
}

bool SXReportingUtilityWait(SXReportingCondition& condition, bool& done,
                            const std::string& waitingMessage, const std::string& failureMessage,
                            SXLogFacility& log, const SXLogScope* scope, double timeoutSeconds) {
  std::unique_lock lock(condition.mutex);
  if (done) return true;
  auto timeout = std::chrono::duration_cast<std::chrono::steady_clock::duration>(
      std::chrono::duration<double>(timeoutSeconds));
  for (;;) {
    SXLOG(log, scope, SXLogLevel::kDefault, "%@", waitingMessage);
    // One pass ends at its deadline or at the first wake-up, whichever comes first.
    if (condition.condition.wait_until(lock, std::chrono::steady_clock::now() + timeout) ==
        std::cv_status::timeout) {
      SXLOG(log, scope, SXLogLevel::kError, "%@", failureMessage);
      return false;
    }
    SXLOG(log, scope, SXLogLevel::kDefault, "continuing");
    if (done) return true;
  }
}
