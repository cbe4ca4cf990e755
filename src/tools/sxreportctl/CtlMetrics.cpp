#include "CtlMetrics.h"

#include <cmath>
#include <iostream>
#include <optional>
#include <set>
#include <string_view>
#include <vector>

#include "common/SXValueText.h"

namespace {

constexpr std::string_view kPrefix = "sxreporting_";

// What the service's own counters and gauges mean, and the label of the nested ones.
struct Known {
  std::string_view key;
  std::string_view help;
  std::string_view label;  // for a nested object
};

constexpr Known kKnownCounters[] = {
    {"messages_received", "Messages that clients sent and the service accepted.", "kind"},
    {"messages_delivered", "Messages handed to each sink.", "sink"},
    {"guardrail_dropped", "Sessions, entries or requests that each guardrail refused.",
     "guardrail"},
    {"store_write_errors", "Writes to each durable store that failed.", "store"},
    {"rows_pruned", "Rows the retention deleted from each store.", "store"},
    {"files_aged_out", "Summary files and damaged store copies the retention removed.", "kind"},
};

constexpr Known kKnownGauges[] = {
    {"sessions_live", "Reporting sessions that exist now.", "kind"},
    {"clients_live", "Client connections open now.", "kind"},
    {"spool_backlog", "Entries in the server-reporting spool waiting to be flushed.", "kind"},
    {"store_bytes", "Bytes each store's pages hold, as the last retention pass measured.", "store"},
};

template <size_t N>
Known describe(const Known (&known)[N], const std::string& key, std::string_view what) {
  for (const auto& entry : known) {
    if (entry.key == key) return entry;
  }
  return {key, what, "kind"};
}

// Metric names allow [a-zA-Z0-9_:]; the prefix makes a leading digit harmless.
std::string metricName(const std::string& key) {
  std::string name(kPrefix);
  for (char c : key) {
    const bool allowed = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
                         (c >= '0' && c <= '9') || c == '_' || c == ':';
    name += allowed ? c : '_';
  }
  return name;
}

std::string escaped(std::string_view text, bool quotes) {
  std::string out;
  for (char c : text) {
    if (c == '\\') {
      out += "\\\\";
    } else if (c == '\n') {
      out += "\\n";
    } else if (c == '"' && quotes) {
      out += "\\\"";
    } else {
      out += c;
    }
  }
  return out;
}

// Booleans count as 1 and 0; anything else that is not a number has no sample.
std::optional<std::string> sampleValue(const SXValue& value) {
  if (value.is_boolean()) return value.get<bool>() ? "1" : "0";
  if (!value.is_number()) return std::nullopt;
  if (value.is_number_float()) {
    const double d = value.get<double>();
    if (std::isnan(d)) return "NaN";
    if (std::isinf(d)) return d > 0 ? "+Inf" : "-Inf";
  }
  return SXValueText(value);
}

class Exposition {
 public:
  // One family: its samples from `value`, a number or an object of numbers (one labelled
  // sample each). Nothing when there is no sample or the name was already used.
  void family(const std::string& name, std::string_view type, std::string_view help,
              std::string_view label, const SXValue& value) {
    std::vector<std::string> samples;
    if (auto text = sampleValue(value)) samples.push_back(name + " " + *text);
    if (value.is_object()) {
      for (const auto& [key, item] : value.items()) {
        if (auto text = sampleValue(item)) {
          samples.push_back(name + "{" + std::string(label) + "=\"" + escaped(key, true) + "\"} " +
                            *text);
        }
      }
    }
    if (samples.empty() || !names_.insert(name).second) return;
    text_ += "# HELP " + name + " " + escaped(help, false) + "\n";
    text_ += "# TYPE " + name + " " + std::string(type) + "\n";
    for (const auto& sample : samples) text_ += sample + "\n";
  }

  std::string take() { return std::move(text_); }

 private:
  std::set<std::string> names_;
  std::string text_;
};

const SXValue& member(const SXValue& object, const char* key) {
  static const SXValue kNull;
  if (!object.is_object()) return kNull;
  auto it = object.find(key);
  return it == object.end() ? kNull : *it;
}

std::string counterName(const std::string& key) {
  std::string name = metricName(key);
  return name.ends_with("_total") ? name : name + "_total";
}

}  // namespace

std::string SXCtlMetricsText(const SXValue& status) {
  Exposition out;
  out.family("sxreporting_up", "gauge", "Whether the reporting service answered.", "kind", 1);
  const SXValue& enabled = member(status, "reportingEnabled");
  if (enabled.is_boolean()) {
    out.family("sxreporting_reporting_enabled", "gauge",
               "Whether reporting is enabled (1) or disabled (0).", "kind", enabled);
  }
  const SXValue& counters = member(status, "counters");
  if (counters.is_object()) {
    for (const auto& [key, value] : counters.items()) {
      const std::string help = "The service's counter \"" + key + "\".";
      const Known known = describe(kKnownCounters, key, help);
      out.family(counterName(key), "counter", known.help, known.label, value);
    }
  }
  const SXValue& gauges = member(status, "gauges");
  if (gauges.is_object()) {
    for (const auto& [key, value] : gauges.items()) {
      const std::string help = "The service's gauge \"" + key + "\".";
      const Known known = describe(kKnownGauges, key, help);
      out.family(metricName(key), "gauge", known.help, known.label, value);
    }
  }
  return out.take();
}

int SXCtlRunMetrics(const SXCtlRequest& request, SXReportingClient& client) {
  SXCallResult<SXValue> result = client.status(SXCtlTimeout(request)).get();
  switch (result.status) {
    case SXCallStatus::kReplied:
      std::cout << SXCtlMetricsText(result.value) << std::flush;
      break;
    case SXCallStatus::kTimedOut:
      std::cerr << "status: the service sent " << result.error << "\n";  // "no reply within 5 s"
      break;
    case SXCallStatus::kRemoteError:
      std::cerr << "status: the service rejected the request: " << result.error << "\n";
      break;
    case SXCallStatus::kConnectionLost:
    case SXCallStatus::kBadReply:
      std::cerr << "status: " << result.error << "\n";
      break;
  }
  return SXCtlExitFor(result.status);
}
