#include "CtlStatus.h"

#include <cmath>
#include <cstdio>

#include "common/SXServiceTypes.h"
#include "common/SXValueText.h"

namespace {

const SXValue& field(const SXValue& object, const char* key) {
  static const SXValue kNull;
  if (!object.is_object()) return kNull;
  auto it = object.find(key);
  return it == object.end() ? kNull : *it;
}

std::string uptimeText(const SXValue& seconds) {
  if (!seconds.is_number()) return "unknown";
  const double s = seconds.get<double>();
  char text[64];
  if (s < 60) {
    std::snprintf(text, sizeof text, "%.1f s", s);
  } else if (s < 3600) {
    std::snprintf(text, sizeof text, "%d min %d s", int(s / 60), int(std::fmod(s, 60)));
  } else if (s < 86400) {
    std::snprintf(text, sizeof text, "%d h %d min", int(s / 3600), int(std::fmod(s, 3600) / 60));
  } else {
    std::snprintf(text, sizeof text, "%.0f d %d h", std::floor(s / 86400),
                  int(std::fmod(s, 86400) / 3600));
  }
  return text;
}

std::string sessionText(const SXValue& session) {
  const SXValue& type = field(session, "serviceType");
  std::string typeName;
  if (field(session, "serviceName").is_string()) {
    typeName = field(session, "serviceName").get<std::string>();
  } else if (type.is_number_unsigned() && type.get<uint64_t>() <= 0xFFFF) {
    typeName = SXServiceTypeName(type.get<SXReportingServiceType>());
  }
  return "    session " + SXValueText(field(session, "reporterID")) + ": " + typeName + " (" +
         SXValueText(type) + "), " +
         (field(session, "started") == true ? "started" : "not started") + "\n";
}

std::string clientText(const SXValue& client) {
  const SXValue& name = field(client, "processName");
  std::string text = "  pid " + SXValueText(field(client, "pid")) + " " +
                     (name.is_string() ? name.get<std::string>() : "(unknown process)") + ", up " +
                     uptimeText(field(client, "uptimeSeconds")) + "\n";
  const SXValue& sessions = field(client, "sessions");
  if (!sessions.is_array() || sessions.empty()) return text + "    (no sessions)\n";
  for (const auto& session : sessions) text += sessionText(session);
  return text;
}

// One "key = value" line per member; a member that is itself an object (a metric with a
// label, such as messages_delivered{sink}) gets its own lines, indented under its name.
std::string keyValueLines(const SXValue& object, const std::string& indent = "  ") {
  if (!object.is_object() || object.empty()) return " (none)\n";
  std::string text = "\n";
  for (const auto& [key, value] : object.items()) {
    if (value.is_object() && !value.empty()) {
      text += indent + key + ":" + keyValueLines(value, indent + "  ");
    } else {
      text += indent + key + " = " + SXValueText(value) + "\n";
    }
  }
  return text;
}

}  // namespace

std::string SXCtlStatusText(const SXValue& status) {
  const SXValue& enabled = field(status, "reportingEnabled");
  std::string text =
      "reporting enabled: " +
      std::string(enabled.is_boolean() ? (enabled.get<bool>() ? "yes" : "no") : "unknown") + "\n";
  const SXValue& clients = field(status, "clients");
  if (!clients.is_array() || clients.empty()) {
    text += "clients: (none)\n";
  } else {
    text += "clients (" + std::to_string(clients.size()) + "):\n";
    for (const auto& client : clients) text += clientText(client);
  }
  text += "defaults:" + keyValueLines(field(status, "defaults"));
  for (const char* section : {"counters", "gauges"}) {
    if (status.is_object() && status.contains(section)) {
      text += std::string(section) + ":" + keyValueLines(field(status, section));
    }
  }
  text.pop_back();  // the caller ends the line
  return text;
}
