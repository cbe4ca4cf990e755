#include "platform/OtlpExportOptions.h"

#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <fstream>

#include "common/SXValueText.h"

#ifndef SXR_PROJECT_VERSION
#define SXR_PROJECT_VERSION ""
#endif

namespace {

using std::chrono::milliseconds;

constexpr const char* kBackendName = "otlp-http";

// A whole number of `key` in [low, high], when present.
std::optional<std::string> ReadCount(const SXValue& section, const char* key, int64_t low,
                                     int64_t high, int64_t& out) {
  auto it = section.find(key);
  if (it == section.end()) return std::nullopt;
  if (!it->is_number_integer() || it->get<int64_t>() < low || it->get<int64_t>() > high) {
    return SXFormat("\"%@\" must be a whole number from %lli to %lli", key, low, high);
  }
  out = it->get<int64_t>();
  return std::nullopt;
}

std::optional<std::string> ReadMilliseconds(const SXValue& section, const char* key,
                                            milliseconds& out) {
  int64_t count = out.count();
  constexpr int64_t kDay = 24 * 3600 * 1000;
  if (auto bad = ReadCount(section, key, 1, kDay, count)) return bad;
  out = milliseconds(count);
  return std::nullopt;
}

std::optional<std::string> ReadEndpoint(const SXValue& section, std::string& endpoint) {
  auto it = section.find("endpoint");
  if (it == section.end()) return std::nullopt;
  if (!it->is_string() || !(it->get<std::string>().starts_with("http://") ||
                            it->get<std::string>().starts_with("https://"))) {
    return std::string("\"endpoint\" must be an http:// or https:// URL");
  }
  endpoint = it->get<std::string>();
  return std::nullopt;
}

// An object of one-line strings under names that could be header names (headers, resource
// attributes).
std::optional<std::string> ReadStrings(const SXValue& section, const char* key,
                                       std::map<std::string, std::string>& out) {
  auto it = section.find(key);
  if (it == section.end()) return std::nullopt;
  if (!it->is_object()) return SXFormat("\"%@\" must be an object of strings", key);
  for (const auto& [name, value] : it->items()) {
    bool clean = name.find_first_of(":\r\n") == std::string::npos && !name.empty();
    if (!clean || !value.is_string() ||
        value.get_ref<const std::string&>().find_first_of("\r\n") != std::string::npos) {
      return SXFormat("\"%@\": \"%@\" must be a name with a one-line string value", key, name);
    }
    out[name] = value.get<std::string>();
  }
  return std::nullopt;
}

// Whether `key`, when present, is `yes` (true) or `no` (false).
std::optional<std::string> ReadChoice(const SXValue& section, const char* key, const char* yes,
                                      const char* no, bool& out) {
  auto it = section.find(key);
  if (it == section.end()) return std::nullopt;
  if (*it != yes && *it != no) return SXFormat("\"%@\" must be \"%@\" or \"%@\"", key, yes, no);
  out = *it == yes;
  return std::nullopt;
}

// The value and name of the first of `names` set to something in `environment`.
std::optional<std::pair<std::string, std::string>> Variable(
    const SXEnvironment& environment, std::initializer_list<const char*> names) {
  for (const char* name : names) {
    auto it = environment.find(name);
    if (it != environment.end() && !it->second.empty()) return std::pair{name, it->second};
  }
  return std::nullopt;
}

std::string Trim(const std::string& text) {
  size_t first = text.find_first_not_of(" \t");
  size_t last = text.find_last_not_of(" \t");
  return first == std::string::npos ? "" : text.substr(first, last - first + 1);
}

std::string PercentDecoded(const std::string& text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '%' && i + 2 < text.size() && std::isxdigit(uint8_t(text[i + 1])) &&
        std::isxdigit(uint8_t(text[i + 2]))) {
      out += static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, 16));
      i += 2;
    } else {
      out += text[i];
    }
  }
  return out;
}

// "key1=value1,key2=value2" with percent-encoded keys and values, the form of the OTLP
// variables for headers and resource attributes, as an object.
std::optional<std::string> ParseList(const std::string& text, SXValue& out) {
  out = SXValue::object();
  size_t start = 0;
  while (start <= text.size()) {
    size_t comma = std::min(text.find(',', start), text.size());
    std::string entry = Trim(text.substr(start, comma - start));
    start = comma + 1;
    if (entry.empty()) continue;
    size_t equals = entry.find('=');
    if (equals == std::string::npos || equals == 0) {
      return SXFormat("\"%@\" is not key=value", entry);
    }
    out[PercentDecoded(Trim(entry.substr(0, equals)))] =
        PercentDecoded(Trim(entry.substr(equals + 1)));
  }
  return std::nullopt;
}

// The "otlp-http" keys the environment sets; on a bad variable returns why, naming it.
std::optional<std::string> EnvironmentSection(const SXEnvironment& environment, SXValue& section) {
  section = SXValue::object();
  if (auto url = Variable(environment, {"OTEL_EXPORTER_OTLP_LOGS_ENDPOINT"})) {
    section["endpoint"] = url->second;
  } else if (auto base = Variable(environment, {"OTEL_EXPORTER_OTLP_ENDPOINT"})) {
    std::string url = base->second;
    if (url.ends_with('/')) url.pop_back();
    section["endpoint"] = url + "/v1/logs";
  }
  if (auto headers = Variable(environment,
                              {"OTEL_EXPORTER_OTLP_LOGS_HEADERS", "OTEL_EXPORTER_OTLP_HEADERS"})) {
    if (auto bad = ParseList(headers->second, section["headers"])) {
      return headers->first + ": " + *bad;
    }
  }
  if (auto timeout = Variable(environment,
                              {"OTEL_EXPORTER_OTLP_LOGS_TIMEOUT", "OTEL_EXPORTER_OTLP_TIMEOUT"})) {
    if (timeout->second.size() > 9 ||
        timeout->second.find_first_not_of("0123456789") != std::string::npos) {
      return timeout->first + ": must be a whole number of milliseconds";
    }
    section["timeoutMs"] = std::stoll(timeout->second);
  }
  if (auto compression = Variable(
          environment, {"OTEL_EXPORTER_OTLP_LOGS_COMPRESSION", "OTEL_EXPORTER_OTLP_COMPRESSION"})) {
    section["compression"] = compression->second;
  }
  if (auto protocol = Variable(
          environment, {"OTEL_EXPORTER_OTLP_LOGS_PROTOCOL", "OTEL_EXPORTER_OTLP_PROTOCOL"})) {
    if (protocol->second != "http/json" && protocol->second != "http/protobuf") {
      return protocol->first + ": must be http/json or http/protobuf";
    }
    section["encoding"] = protocol->second.substr(5);
  }
  SXValue attributes = SXValue::object();
  if (auto listed = Variable(environment, {"OTEL_RESOURCE_ATTRIBUTES"})) {
    if (auto bad = ParseList(listed->second, attributes)) return listed->first + ": " + *bad;
  }
  if (auto name = Variable(environment, {"OTEL_SERVICE_NAME"})) {
    attributes["service.name"] = name->second;
  }
  if (!attributes.empty()) section["resourceAttributes"] = std::move(attributes);
  return std::nullopt;
}

// `fromFile` over `fromEnvironment`: the file's keys win, and the file's entries win within
// headers and resource attributes.
SXValue Merged(SXValue fromEnvironment, const SXValue& fromFile) {
  for (const auto& [key, value] : fromFile.items()) {
    SXValue& slot = fromEnvironment[key];
    if (slot.is_object() && value.is_object()) {
      slot.update(value);
    } else {
      slot = value;
    }
  }
  return fromEnvironment;
}

// The OTEL_ variables of this process.
SXEnvironment ProcessEnvironment() {
  SXEnvironment environment;
  for (char** entry = environ; entry && *entry; ++entry) {
    std::string_view text(*entry);
    size_t equals = text.find('=');
    if (text.starts_with("OTEL_") && equals != std::string_view::npos) {
      environment.emplace(text.substr(0, equals), text.substr(equals + 1));
    }
  }
  return environment;
}

}  // namespace

SXResult<SXOtlpExportOptions> SXOtlpExportOptions::fromJson(const SXValue& section) {
  static const char* const kKnown[] = {"endpoint",      "headers",           "batchSize",
                                       "maxBatchBytes", "intervalMs",        "initialBackoffMs",
                                       "maxBackoffMs",  "timeoutMs",         "compression",
                                       "encoding",      "resourceAttributes"};
  if (!section.is_object()) return SXFailure("must be an object");
  for (const auto& [key, value] : section.items()) {
    if (std::find(std::begin(kKnown), std::end(kKnown), key) == std::end(kKnown)) {
      return SXFailure(SXFormat("unknown key \"%@\"", key));
    }
  }
  SXOtlpExportOptions options;
  options.resource.serviceVersion = SXR_PROJECT_VERSION;
  int64_t batchSize = int64_t(options.batchSize), maxBytes = int64_t(options.maxBatchBytes);
  bool protobuf = false;
  std::optional<std::string> bad = ReadEndpoint(section, options.endpoint);
  if (!bad) bad = ReadStrings(section, "headers", options.headers);
  if (!bad) bad = ReadCount(section, "batchSize", 1, 100000, batchSize);
  if (!bad) bad = ReadCount(section, "maxBatchBytes", 1, int64_t(1) << 30, maxBytes);
  if (!bad) bad = ReadMilliseconds(section, "intervalMs", options.interval);
  if (!bad) bad = ReadMilliseconds(section, "initialBackoffMs", options.initialBackoff);
  if (!bad) bad = ReadMilliseconds(section, "maxBackoffMs", options.maxBackoff);
  if (!bad) bad = ReadMilliseconds(section, "timeoutMs", options.timeout);
  if (!bad) bad = ReadChoice(section, "compression", "gzip", "none", options.gzip);
  if (!bad) bad = ReadChoice(section, "encoding", "protobuf", "json", protobuf);
  if (!bad) bad = ReadStrings(section, "resourceAttributes", options.resource.attributes);
  if (!bad && options.maxBackoff < options.initialBackoff) {
    bad = "\"maxBackoffMs\" must not be below \"initialBackoffMs\"";
  }
  if (bad) return SXFailure(*bad);
  options.batchSize = size_t(batchSize);
  options.maxBatchBytes = size_t(maxBytes);
  options.encoding = protobuf ? Encoding::kProtobuf : Encoding::kJson;
  return options;
}

SXResult<SXOtlpExportOptions> SXOtlpExportOptions::fromSources(const SXValue& section,
                                                               const SXEnvironment& environment) {
  SXValue fromEnvironment;
  if (auto bad = EnvironmentSection(environment, fromEnvironment)) {
    return SXFailure("environment: " + *bad);
  }
  // Checked alone first, so that an error says where the bad value came from.
  if (auto alone = fromJson(fromEnvironment); !alone.ok()) {
    return SXFailure("environment: " + alone.error());
  }
  if (!section.is_object()) return fromJson(section);
  return fromJson(Merged(std::move(fromEnvironment), section));
}

std::optional<SXOtlpExportOptions> SXOtlpExportOptions::load(
    const std::string& configPath, const std::vector<std::string>& backends, SXLogFacility& log) {
  if (std::find(backends.begin(), backends.end(), kBackendName) == backends.end()) {
    return std::nullopt;
  }
  std::ifstream in(configPath);
  SXValue config = SXValue::parse(in, nullptr, false);
  SXValue section = SXValue::object();  // no "otlp-http" object: every default
  if (config.is_object() && config.contains(kBackendName)) section = config[kBackendName];
  auto options = fromSources(section, ProcessEnvironment());
  if (!options.ok()) {
    SXLOG(log, nullptr, SXLogLevel::kError,
          "%@: \"otlp-http\": %@; not exporting (messages stay in the spool)", configPath,
          options.error());
    return std::nullopt;
  }
  return std::move(*options);
}
