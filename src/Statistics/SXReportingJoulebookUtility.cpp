#include "SXReportingJoulebookUtility.h"

void SXReportingJoulebookUtility::handleEvent(SXReportingEnvironment& environment,
                                              const SXValue* payload, SXReportingCategory,
                                              SXReportingMessageType,
                                              const SXReportingEventSession& session) {
  if (!payload || !payload->is_object()) return;
  auto onTime = payload->find("EngineOnTime");
  if (onTime == payload->end()) return;
  SXValue entry = {{"EngineOnDuration", *onTime},
                   {"ApplicationName", session.hostApplicationName()}};
  if (auto stamp = payload->find("sxreporting_timestamp"); stamp != payload->end()) {
    entry["TimestampEnd"] = *stamp;
  } else {
    SXLOG(environment.log(), nullptr, SXLogLevel::kError,
          "failed to get SXReporting timestamp for joulebook");
  }
  environment.platform().joulebook->logRegisteredEvent(28, "Flumen_Haptics", entry, std::nullopt);
}
