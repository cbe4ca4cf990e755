// The reporting vocabulary: names of categories and message types (service types are in
// common/SXServiceTypes.h), the host application name of a configuration, and the bounded
// wait on a condition.
#pragma once

#include <condition_variable>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/Log.h"
#include "sxreporting/types.h"

class SXReportingEnvironment;

// Component prefix and category proper, for example "Session_Playback".
std::string SXReportingUtilityCategoryName(SXReportingCategory category);
const std::string& SXReportingUtilityTypeName(SXReportingMessageType type);
// The kind of a message: its category name and type name joined by "_", for example
// "Session_Playback_Start". The reference stays valid until the next call on the same thread.
const std::string& SXReportingUtilityMessageKind(SXReportingCategory category,
                                                 SXReportingMessageType type);
// The configuration's "HostApplicationDisplayID" as stored, or "Unknown".
SXValue SXReportingUtilityHostApplicationName(const SXValue* configuration);
// Whether the device runs an internal build (asked once per environment).
bool SXReportingUtilityIsInternalBuild(SXReportingEnvironment& environment);

// Names built from a (category, type) pair, kept per thread so that the strings of the few
// pairs a client uses are built once instead of for every message. Capped, so that a client
// cycling through many codes cannot grow it without bound. Not thread-safe: one per thread.
class SXReportingPairNameCache {
 public:
  // The name of the pair, built by `build()` when not cached. Valid until the next call.
  template <typename Build>
  const std::string& get(SXReportingCategory category, SXReportingMessageType type, Build&& build) {
    uint64_t key = (uint64_t{category} << 16) | type;
    auto it = names_.find(key);
    if (it != names_.end()) return it->second;
    if (names_.size() >= kMaxEntries) names_.clear();
    return names_.emplace(key, build()).first->second;
  }

 private:
  static constexpr size_t kMaxEntries = 256;
  std::unordered_map<uint64_t, std::string> names_;
};

// A lock with wait-until-deadline and signal. The thread that sets a done flag sets it while
// holding `mutex` and then calls `signal`.
struct SXReportingCondition {
  std::mutex mutex;
  std::condition_variable condition;
  void signal() { condition.notify_one(); }
};

// Waits until `done` is seen set: true then; false when one wait pass of `timeoutSeconds`
// runs out. Logs `waitingMessage` before each pass, "continuing" after a signal, and
// `failureMessage` at the deadline, through `scope` (nullptr: the default log).
bool SXReportingUtilityWait(SXReportingCondition& condition, bool& done,
                            const std::string& waitingMessage, const std::string& failureMessage,
                            SXLogFacility& log, const SXLogScope* scope, double timeoutSeconds);
