#include "SXReportingTallyvaneBridge.h"

#include "SXReportingSession.h"
#include "SXReportingUtility.h"

std::string SXReportingTallyvaneBridge::eventName(SXReportingCategory category,
                                                  SXReportingMessageType type) {
  return "com.vendra.sonex." + SXReportingUtilityCategoryName(category) + "." +
         SXReportingUtilityTypeName(type);
}

void SXReportingTallyvaneBridge::handleEvent(SXReportingEnvironment& environment,
                                             const SXValue& payload, SXReportingCategory category,
                                             SXReportingMessageType type,
                                             const SXReportingSession& session) {
  // The provider may run later on another thread, so it owns its own copy.
  auto copy = std::make_shared<SXValue>(payload.is_object() ? payload : SXValue::object());
  (*copy)["HostApplicationDisplayID"] = session.hostApplicationName();
  thread_local SXReportingPairNameCache names;
  const std::string& name = names.get(category, type, [&] { return eventName(category, type); });
  environment.platform().tallyvane->sendEventLazy(name, [copy] { return *copy; });
}
