#include "SXReportingTallyvaneBridge.h"

#include "SXReportingSession.h"
#include "SXReportingUtility.h"
#include "common/SXValueText.h"

namespace {
const std::string kHostKey = "HostApplicationDisplayID";
}  // namespace

std::string SXReportingTallyvaneBridge::eventName(SXReportingCategory category,
                                                  SXReportingMessageType type) {
  return "com.vendra.sonex." + SXReportingUtilityCategoryName(category) + "." +
         SXReportingUtilityTypeName(type);
}

void SXReportingTallyvaneBridge::handleEvent(SXReportingEnvironment& environment,
                                             std::shared_ptr<const SXValue> payload,
                                             SXReportingCategory category,
                                             SXReportingMessageType type,
                                             const SXReportingSession& session) {
  thread_local SXReportingPairNameCache names;
  const std::string& name = names.get(category, type, [&] { return eventName(category, type); });
  auto host = std::make_shared<const SXValue>(session.hostApplicationName());
  environment.platform().tallyvane->sendEventLazy(
      name,
      [payload, host] {
        SXValue copy = payload->is_object() ? *payload : SXValue::object();
        copy[kHostKey] = *host;
        return copy;
      },
      // A store of JSON text gets the same payload's text without the copy.
      [payload, host] { return SXValueTextWithMember(*payload, kHostKey, *host); });
}
