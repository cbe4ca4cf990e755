// Writes a power-log entry "Flumen_Haptics" (client 28) for every delivered message whose
// payload reports an engine on-time. Stateless; runs on its caller's thread.
#pragma once

#include "SXReportingEnvironment.h"
#include "SXReportingEventSession.h"
#include "common/SXPackedValue.h"


class SXReportingJoulebookUtility {
 public:
  static void handleEvent(SXReportingEnvironment& environment, const SXPackedValue& payload,
                          SXReportingCategory category, SXReportingMessageType type,
                          const SXReportingEventSession& session);
};
