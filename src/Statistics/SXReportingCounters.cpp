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
    case SXReportingGuardrail::kAggregateBytes:
      return "aggregate_bytes";
    case SXReportingGuardrail::kStandalonePending:
      return "standalone_pending";
    case SXReportingGuardrail::kPayloadBytes:
      return "payload_bytes";
    case SXReportingGuardrail::kConfigurationBytes:
      return "configuration_bytes";
    case SXReportingGuardrail::kReporterIDs:
      return "reporter_ids";
    case SXReportingGuardrail::kErrorLines:
      return "error_lines";
    case SXReportingGuardrail::kConnectionsPerClient:
      return "connections_per_client";
    case SXReportingGuardrail::kCount:
      break;
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
  for (size_t i = 0; i < index(SXReportingGuardrail::kCount); ++i) {
    auto guardrail = static_cast<SXReportingGuardrail>(i);
    dropped[name(guardrail)] = droppedBy(guardrail);
  }
  return {{"messages_received", messagesReceived()},
          {"messages_delivered", std::move(delivered)},
          {"guardrail_dropped", std::move(dropped)}};
}
