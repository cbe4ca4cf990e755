// Turns a message delivered to a session into an analytics event named after its category and
// type, "com.vendra.sonex.<category>.<type>", with the host application's name added.
// Stateless; runs on its caller's thread.
#pragma once

#include "SXReportingEnvironment.h"

class SXReportingSession;

class SXReportingTallyvaneBridge {
 public:
  // `payload` is never changed by anyone, so the event's copy of it (with the host name) is
  // made when the analytics service asks for it, on the service's thread.
  static void handleEvent(SXReportingEnvironment& environment,
                          std::shared_ptr<const SXValue> payload, SXReportingCategory category,
                          SXReportingMessageType type, const SXReportingSession& session);
  static void handleEvent(SXReportingEnvironment& environment, const SXValue& payload,
                          SXReportingCategory category, SXReportingMessageType type,
                          const SXReportingSession& session) {
    handleEvent(environment, std::make_shared<const SXValue>(payload), category, type, session);
  }
  static std::string eventName(SXReportingCategory category, SXReportingMessageType type);
};
