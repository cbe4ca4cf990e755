#include "export/OtlpExportOptions.h"

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
SXStatus ReadCount(const SXValue& section, const char* key, int64_t low, int64_t high,
                   int64_t& out) {
  auto it = section.find(key);
  if (it == section.end()) return {};
  if (!it->is_number_integer() || it->get<int64_t>() < low || it->get<int64_t>() > high) {
    return SXFailure(SXFormat("\"%@\" must be a whole number from %lli to %lli", key, low, high));
  }
  out = it->get<int64_t>();
  return {};
}

SXStatus ReadMilliseconds(const SXValue& section, const char* key, milliseconds& out) {
  int64_t count = out.count();
  constexpr int64_t kDay = 24 * 3600 * 1000;
  if (SXStatus read = ReadCount(section, key, 1, kDay, count); !read.ok()) return read;
  out = milliseconds(count);
  return {};
}

SXStatus ReadEndpoint(const SXValue& section, std::string& endpoint) {
  auto it = section.find("endpoint");
  if (it == section.end()) return {};
  if (!it->is_string() || !(it->get<std::string>().starts_with("http://") ||
                            it->get<std::string>().starts_with("https://"))) {
    return SXFailure("\"endpoint\" must be an http:// or https:// URL");
  }
  endpoint = it->get<std::string>();
  return {};
}

// An object of one-line strings under names that could be header names (headers, resource
// attributes).
SXStatus ReadStrings(const SXValue& section, const char* key,
                     std::map<std::string, std::string>& out) {
  auto it = section.find(key);
  if (it == section.end()) return {};
  if (!it->is_object()) return SXFailure(SXFormat("\"%@\" must be an object of strings", key));
  for (const auto& [name, value] : it->items()) {
    bool clean = name.find_first_of(":\r\n") == std::string::npos && !name.empty();
    if (!clean || !value.is_string() ||
        value.get_ref<const std::string&>().find_first_of("\r\n") != std::string::npos) {
      return SXFailure(
          SXFormat("\"%@\": \"%@\" must be a name with a one-line string value", key, name));
    }
    out[name] = value.get<std::string>();
  }
  return {};
}

// Whether `key`, when present, is `yes` (true) or `no` (false).
SXStatus ReadChoice(const SXValue& section, const char* key, const char* yes, const char* no,
                    bool& out) {
  auto it = section.find(key);
  if (it == section.end()) return {};
  if (*it != yes && *it != no) {
    return SXFailure(SXFormat("\"%@\" must be \"%@\" or \"%@\"", key, yes, no));
  }
  out = *it == yes;
  return {};
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
SXResult<SXValue> ParseList(const std::string& text) {
  SXValue out = SXValue::object();
  size_t start = 0;
  while (start <= text.size()) {
    size_t comma = std::min(text.find(',', start), text.size());
    std::string entry = Trim(text.substr(start, comma - start));
    start = comma + 1;
    if (entry.empty()) continue;
    size_t equals = entry.find('=');
    if (equals == std::string::npos || equals == 0) {
      return SXFailure(SXFormat("\"%@\" is not key=value", entry));
    }
    out[PercentDecoded(Trim(entry.substr(0, equals)))] =
        PercentDecoded(Trim(entry.substr(equals + 1)));
  }
  return out;
}

// The "otlp-http" keys the environment sets; a bad variable fails, naming it.
SXResult<SXValue> EnvironmentSection(const SXEnvironment& environment) {
  SXValue section = SXValue::object();
  if (auto url = Variable(environment, {"OTEL_EXPORTER_OTLP_LOGS_ENDPOINT"})) {
    section["endpoint"] = url->second;
  } else if (auto base = Variable(environment, {"OTEL_EXPORTER_OTLP_ENDPOINT"})) {
    std::string url = base->second;
    if (url.ends_with('/')) url.pop_back();
    section["endpoint"] = url + "/v1/logs";
  }
  if (auto headers = Variable(environment,
                              {"OTEL_EXPORTER_OTLP_LOGS_HEADERS", "OTEL_EXPORTER_OTLP_HEADERS"})) {
    auto parsed = ParseList(headers->second);
    if (!parsed.ok()) return SXFailure(headers->first + ": " + parsed.error());
    section["headers"] = std::move(*parsed);
  }
  if (auto timeout = Variable(environment,
                              {"OTEL_EXPORTER_OTLP_LOGS_TIMEOUT", "OTEL_EXPORTER_OTLP_TIMEOUT"})) {
    if (timeout->second.size() > 9 ||
        timeout->second.find_first_not_of("0123456789") != std::string::npos) {
      return SXFailure(timeout->first + ": must be a whole number of milliseconds");
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
      return SXFailure(protocol->first + ": must be http/json or http/protobuf");
    }
    section["encoding"] = protocol->second.substr(5);
  }
  SXValue attributes = SXValue::object();
  if (auto listed = Variable(environment, {"OTEL_RESOURCE_ATTRIBUTES"})) {
    auto parsed = ParseList(listed->second);
    if (!parsed.ok()) return SXFailure(listed->first + ": " + parsed.error());
    attributes = std::move(*parsed);
  }
  if (auto name = Variable(environment, {"OTEL_SERVICE_NAME"})) {
    attributes["service.name"] = name->second;
  }
  if (!attributes.empty()) section["resourceAttributes"] = std::move(attributes);
  return section;
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
  SXStatus bad = ReadEndpoint(section, options.endpoint);
  if (bad.ok()) bad = ReadStrings(section, "headers", options.headers);
  if (bad.ok()) bad = ReadCount(section, "batchSize", 1, 100000, batchSize);
  if (bad.ok()) bad = ReadCount(section, "maxBatchBytes", 1, int64_t(1) << 30, maxBytes);
  if (bad.ok()) bad = ReadMilliseconds(section, "intervalMs", options.interval);
  if (bad.ok()) bad = ReadMilliseconds(section, "initialBackoffMs", options.initialBackoff);
  if (bad.ok()) bad = ReadMilliseconds(section, "maxBackoffMs", options.maxBackoff);
  if (bad.ok()) bad = ReadMilliseconds(section, "timeoutMs", options.timeout);
  if (bad.ok()) bad = ReadChoice(section, "compression", "gzip", "none", options.gzip);
  if (bad.ok()) bad = ReadChoice(section, "encoding", "protobuf", "json", protobuf);
  if (bad.ok()) bad = ReadStrings(section, "resourceAttributes", options.resource.attributes);
  if (bad.ok() && options.maxBackoff < options.initialBackoff) {
    bad = SXFailure("\"maxBackoffMs\" must not be below \"initialBackoffMs\"");
  }
  if (!bad.ok()) return bad;
  options.batchSize = size_t(batchSize);
  options.maxBatchBytes = size_t(maxBytes);
  options.encoding = protobuf ? Encoding::kProtobuf : Encoding::kJson;
  return options;
}

SXResult<SXOtlpExportOptions> SXOtlpExportOptions::fromSources(const SXValue& section,
                                                               const SXEnvironment& environment) {
  SXResult<SXValue> fromEnvironment = EnvironmentSection(environment);
  if (!fromEnvironment.ok()) return SXFailure("environment: " + fromEnvironment.error());
  // Checked alone first, so that an error says where the bad value came from.
  if (auto alone = fromJson(*fromEnvironment); !alone.ok()) {
    return SXFailure("environment: " + alone.error());
  }
  if (!section.is_object()) return fromJson(section);
  return fromJson(Merged(std::move(*fromEnvironment), section));
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
