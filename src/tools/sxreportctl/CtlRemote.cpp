#include "CtlRemote.h"

#include <cstdio>
#include <iostream>

#include "CtlMetrics.h"
#include "CtlStatus.h"
#include "common/SXServiceTypes.h"

namespace {

struct Outcome {
  SXCallStatus status = SXCallStatus::kReplied;
  std::string error;
  SXValue json;         // the reply as it came over the wire
  std::string text;     // the reply for people
  bool failed = false;  // the reply says the operation did not happen
};

std::string jsonText(const SXValue& value, int indent = -1) {
  return value.dump(indent, ' ', false, SXValue::error_handler_t::replace);
}

std::string typeText(SXReportingServiceType type) {
  return std::to_string(type) + " (" + SXServiceTypeName(type) + ")";
}

// The wire form of each reply type, for --json.
SXValue wireValue(bool value) { return value; }
SXValue wireValue(SXReportingServiceType value) { return value; }
SXValue wireValue(const SXValue& value) { return value; }
SXValue wireValue(const std::vector<int64_t>& ids) { return ids; }
SXValue wireValue(const SXReporterIDValidity& v) {
  return {{"reporterID", v.reporterID}, {"serviceType", v.serviceType}};
}
SXValue wireValue(const std::optional<SXError>& error) {
  if (!error) return nullptr;
  return {{"domain", error->domain}, {"code", error->code}};
}

// Whether a reply reports a failure: false, or an error instead of a delivery.
bool failure(bool value) { return !value; }
bool failure(const std::optional<SXError>& error) { return error.has_value(); }
template <typename T>
bool failure(const T&) {
  return false;
}

std::string boolText(bool value) { return value ? "true" : "false"; }

std::string sendText(const std::optional<SXError>& error) {
  if (!error) return "delivered";
  std::string what =
      error->domain == kSXReportingErrorDomain && error->code == kSXReportingErrorReportingDisabled
          ? "reporting is disabled"
          : "the service replied with an error";
  return "not delivered: " + what + " (domain " + error->domain + ", code " +
         std::to_string(error->code) + ")";
}

std::string validText(const SXReporterIDValidity& v) {
  return "reporterID " + std::to_string(v.reporterID) + ", serviceType " + typeText(v.serviceType);
}

std::string listText(const std::vector<int64_t>& ids) {
  if (ids.empty()) return "(none)";
  std::string text;
  for (size_t i = 0; i < ids.size(); ++i) text += (i ? "\n" : "") + std::to_string(ids[i]);
  return text;
}

template <typename T, typename Describe>
Outcome finish(std::future<SXCallResult<T>> future, Describe describe) {
  SXCallResult<T> result = future.get();
  Outcome outcome{result.status, std::move(result.error), nullptr, {}};
  if (result.replied()) {
    outcome.json = wireValue(result.value);
    outcome.text = describe(result.value);
    outcome.failed = failure(result.value);
  }
  return outcome;
}

Outcome perform(SXReportingClient& client, const SXCtlRequest& r) {
  const SXTimeout timeout = SXCtlTimeout(r);
  const std::string& c = r.command;
  const int64_t id = r.reporterID;
  if (c == "create") return finish(client.createReportingSession(id, timeout), boolText);
  if (c == "set-type") return finish(client.setServiceType(r.serviceType, id, timeout), boolText);
  if (c == "get-type") return finish(client.getServiceNameForReporterID(id, timeout), typeText);
  if (c == "configure") {
    return finish(client.setConfiguration(r.configuration, id, timeout), boolText);
  }
  if (c == "start") return finish(client.startReportingSessionForID(id, timeout), boolText);
  if (c == "send") {
    return finish(client.sendMessage(r.payload, r.category, r.messageType, r.reporterIDs, timeout),
                  sendText);
  }
  if (c == "stop") return finish(client.stopReportingSessionForID(id, timeout), boolText);
  if (c == "destroy") return finish(client.destroyReportingSession(id, timeout), boolText);
  if (c == "valid") return finish(client.reporterID(id, timeout), validText);
  if (c == "list") return finish(client.getAllReporters(timeout), listText);
  if (c == "kill") return finish(client.killService(timeout), boolText);
  return finish(client.status(timeout), SXCtlStatusText);
}

std::string waitedText(const SXCtlRequest& request) {
  auto timeout = SXCtlTimeout(request);
  if (!timeout || *timeout == kSXWaitForever) return "";
  char text[64];
  std::snprintf(text, sizeof text, " within %g s", static_cast<double>(timeout->count()) / 1000);
  return text;
}

int report(const SXCtlRequest& request, const Outcome& outcome) {
  const std::string& name = request.command;
  switch (outcome.status) {
    case SXCallStatus::kReplied:
      std::cout << (request.json ? jsonText(outcome.json) : outcome.text) << "\n";
      return outcome.failed ? kSXCtlFailed : kSXCtlOK;
    case SXCallStatus::kTimedOut:
      std::cerr << name << ": the service sent no reply" << waitedText(request) << "\n";
      break;
    case SXCallStatus::kConnectionLost:
      if (name == "kill") {  // the service exits instead of replying
        std::cout << (request.json ? "null" : "the service closed the connection") << "\n";
        return kSXCtlOK;
      }
      std::cerr << name << ": " << outcome.error << "\n";
      break;
    case SXCallStatus::kRemoteError:
      std::cerr << name << ": the service rejected the request: " << outcome.error << "\n";
      break;
    case SXCallStatus::kBadReply:
      std::cerr << name << ": " << outcome.error << "\n";
      break;
  }
  return SXCtlExitFor(outcome.status);
}

}  // namespace

int SXCtlRunRemote(const SXCtlRequest& request, SXReportingClient& client) {
  if (request.metrics) return SXCtlRunMetrics(request, client);
  return report(request, perform(client, request));
}
