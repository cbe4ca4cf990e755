// The reporting vocabulary: names of service types, categories and message types, the host
// application name of a configuration, and the bounded wait on a condition.
#pragma once

#include <condition_variable>
#include <mutex>
#include <optional>
#include <string>

#include "platform/Log.h"
#include "sxreporting/types.h"

class SXReportingEnvironment;

// "generic" ... "test", "unknown"; codes 12-65534 are named "servicetype<code>".
const std::string& SXReportingUtilityServiceTypeName(SXReportingServiceType serviceType);
// Component prefix and category proper, for example "Session_Playback".
std::string SXReportingUtilityCategoryName(SXReportingCategory category);
const std::string& SXReportingUtilityTypeName(SXReportingMessageType type);
// The configuration's "HostApplicationDisplayID" as stored, or "Unknown".
SXValue SXReportingUtilityHostApplicationName(const SXValue* configuration);
// Whether the device runs an internal build (asked once per environment).
bool SXReportingUtilityIsInternalBuild(SXReportingEnvironment& environment);

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
