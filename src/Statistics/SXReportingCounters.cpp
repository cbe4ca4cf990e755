#include "SXReportingCounters.h"

const char* SXReportingCounters::name(SXReportingSink sink) {
  switch (sink) {
    case SXReportingSink::kTallyvane:
      return "tallyvane";
    case SXReportingSink::kJoulebook:
      return "joulebook";
    case SXReportingSink::kFernReporting:
      return "fernreporting";
  }
  return "unknown";
}

const char* SXReportingCounters::name(SXReportingGuardrail guardrail) {
  switch (guardrail) {
    case SXReportingGuardrail::kSessionsPerClient:
      return "sessions_per_client";
    case SXReportingGuardrail::kSessionsTotal:
      return "sessions_total";
    case SXReportingGuardrail::kAggregateEntries:
      return "aggregate_entries";
    case SXReportingGuardrail::kStandalonePending:
      return "standalone_pending";
  }
  return "unknown";
}

SXValue SXReportingCounters::toValue() const {
  SXValue delivered = SXValue::object();
  for (auto sink : {SXReportingSink::kTallyvane, SXReportingSink::kJoulebook,
                    SXReportingSink::kFernReporting}) {
    delivered[name(sink)] = deliveredTo(sink);
  }
  SXValue dropped = SXValue::object();
  for (auto guardrail :
       {SXReportingGuardrail::kSessionsPerClient, SXReportingGuardrail::kSessionsTotal,
        SXReportingGuardrail::kAggregateEntries, SXReportingGuardrail::kStandalonePending}) {
    dropped[name(guardrail)] = droppedBy(guardrail);
  }
  return {{"messages_received", messagesReceived()},
          {"messages_delivered", std::move(delivered)},
          {"guardrail_dropped", std::move(dropped)}};
}
