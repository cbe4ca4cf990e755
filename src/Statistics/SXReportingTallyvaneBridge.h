// Turns a message delivered to a session into an analytics event named after its category and
// type, "com.vendra.sonex.<category>.<type>", with the host application's name added.
// Stateless; runs on its caller's thread.
#pragma once

#include "SXReportingEnvironment.h"

class SXReportingSession;

class SXReportingTallyvaneBridge {
 public:
  static void handleEvent(SXReportingEnvironment& environment, const SXValue& payload,
                          SXReportingCategory category, SXReportingMessageType type,
                          const SXReportingSession& session);
  static std::string eventName(SXReportingCategory category, SXReportingMessageType type);
};
