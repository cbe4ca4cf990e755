#include "SXReportingJoulebookUtility.h"

void SXReportingJoulebookUtility::handleEvent(SXReportingEnvironment& environment,
                                              const SXPackedValue& packed,
                                              SXReportingCategory, SXReportingMessageType,
                                              const SXReportingEventSession& session) {
  // Looked for in the bytes: nearly every message has no on-time and is never decoded here.
  if (!packed.hasMember("EngineOnTime")) return;
  const SXValue payload = packed.value();
  SXValue entry = {{"EngineOnDuration", payload.at("EngineOnTime")},
                   {"ApplicationName", session.hostApplicationName()}};
  if (auto stamp = payload.find("sxreporting_timestamp"); stamp != payload.end()) {
    entry["TimestampEnd"] = *stamp;
  } else {
    SXLOG(environment.log(), nullptr, SXLogLevel::kError,
          "failed to get SXReporting timestamp for joulebook");
  }
  environment.platform().joulebook->logRegisteredEvent(28, "Flumen_Haptics", entry, std::nullopt);
}
