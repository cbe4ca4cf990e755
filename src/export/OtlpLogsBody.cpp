#include "export/OtlpLogsBody.h"

#include <cmath>
#include <limits>
#include <optional>

#include "platform/FernReporting.h"

namespace {

constexpr int kSeverityInfo = 9;

SXValue KeyValue(const std::string& key, SXValue anyValue) {
  return {{"key", key}, {"value", std::move(anyValue)}};
}

SXValue StringValue(const std::string& text) { return {{"stringValue", text}}; }
SXValue IntValue(int64_t value) { return {{"intValue", std::to_string(value)}}; }

// JSON has no NaN or infinities; the protobuf JSON mapping writes them as strings.
SXValue DoubleValue(double value) {
  if (std::isnan(value)) return {{"doubleValue", "NaN"}};
  if (std::isinf(value)) return {{"doubleValue", value > 0 ? "Infinity" : "-Infinity"}};
  return {{"doubleValue", value}};
}

SXValue BytesValue(const std::vector<uint8_t>& bytes) {
  static constexpr char kDigits[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  for (size_t i = 0; i < bytes.size(); i += 3) {
    uint32_t group = uint32_t(bytes[i]) << 16;
    if (i + 1 < bytes.size()) group |= uint32_t(bytes[i + 1]) << 8;
    if (i + 2 < bytes.size()) group |= bytes[i + 2];
    for (size_t digit = 0; digit < 4; ++digit) {
      text += i + digit <= bytes.size() ? kDigits[(group >> (18 - 6 * digit)) & 63] : '=';
    }
  }
  return {{"bytesValue", text}};
}

// The bytes of a binary value as a JSON store keeps it, {"bytes": [...], "subtype": ...}.
std::optional<std::vector<uint8_t>> StoredBytes(const SXValue& object) {
  if (object.size() != 2 || !object.contains("subtype")) return std::nullopt;
  auto bytes = object.find("bytes");
  if (bytes == object.end() || !bytes->is_array()) return std::nullopt;
  std::vector<uint8_t> out;
  for (const SXValue& byte : *bytes) {
    if (!byte.is_number_unsigned() || byte.get<uint64_t>() > 255) return std::nullopt;
    out.push_back(static_cast<uint8_t>(byte.get<uint64_t>()));
  }
  return out;
}

// Nanoseconds since the epoch of a time in seconds, as a decimal string; "0" when unknown.
std::string UnixNano(const SXValue& seconds) {
  if (!seconds.is_number()) return "0";
  double nanos = std::round(seconds.get<double>() * 1e9);
  if (!(nanos > 0) || nanos >= 1.8e19) return "0";
  return std::to_string(static_cast<uint64_t>(nanos));
}

// A dictionary column; an empty object when the column is null or not a JSON object.
SXValue ParsedObject(const SXValue& column) {
  if (!column.is_string()) return SXValue::object();
  SXValue parsed = SXValue::parse(column.get<std::string>(), nullptr, false);
  return parsed.is_object() ? parsed : SXValue::object();
}

void AddIfPresent(SXValue& attributes, const char* key, const SXValue& value) {
  if (value.is_null() || value.is_discarded()) return;
  attributes.push_back(KeyValue(key, SXOtlpAnyValue(value)));
}

SXValue Member(const SXValue& object, const char* key) {
  auto it = object.find(key);
  return it == object.end() ? SXValue() : *it;
}

SXValue Attributes(const SXOtlpSpooledRow& row) {
  SXValue sessionInfo = ParsedObject(Member(row, "session_info_json"));
  SXValue userInfo = ParsedObject(Member(row, "user_info_json"));
  SXValue sessionId = Member(row, "session_id");
  SXValue attributes = SXValue::array();
  AddIfPresent(attributes, "sxr.message.id", Member(row, "id"));
  attributes.push_back(
      KeyValue("sxr.message.kind", StringValue(sessionId.is_null() ? "standalone" : "session")));
  AddIfPresent(attributes, "sxr.category", Member(row, "category"));
  AddIfPresent(attributes, "sxr.type", Member(row, "type"));
  AddIfPresent(attributes, "sxr.reporter_id", Member(sessionInfo, fern::kSessionInfoSessionID));
  AddIfPresent(attributes, "sxr.service_name", Member(userInfo, fern::kUserInfoServiceName));
  AddIfPresent(attributes, "sxr.client_name", Member(userInfo, fern::kUserInfoClientName));
  AddIfPresent(attributes, "sxr.session.spool_id", sessionId);
  AddIfPresent(attributes, "sxr.session.token", Member(row, "token"));
  return attributes;
}

SXValue Body(const SXValue& payloadColumn) {
  if (!payloadColumn.is_string()) return SXValue::object();  // an empty AnyValue
  const std::string& text = payloadColumn.get_ref<const std::string&>();
  SXValue payload = SXValue::parse(text, nullptr, false);
  if (payload.is_discarded()) return StringValue(text);
  return SXOtlpAnyValue(payload);
}

SXValue LogRecord(const SXOtlpSpooledRow& row, const std::string& observedNano) {
  return {{"timeUnixNano", UnixNano(Member(row, "time"))},
          {"observedTimeUnixNano", observedNano},
          {"severityNumber", kSeverityInfo},
          {"severityText", "INFO"},
          {"body", Body(Member(row, "payload_json"))},
          {"attributes", Attributes(row)}};
}

SXValue ResourceAttributes(const SXOtlpResource& resource) {
  std::map<std::string, std::string> named = {{"service.name", resource.serviceName}};
  if (!resource.serviceVersion.empty()) named["service.version"] = resource.serviceVersion;
  if (!resource.hostName.empty()) named["host.name"] = resource.hostName;
  for (const auto& [key, value] : resource.attributes) named[key] = value;
  SXValue attributes = SXValue::array();
  for (const auto& [key, value] : named) attributes.push_back(KeyValue(key, StringValue(value)));
  return attributes;
}

}  // namespace

SXValue SXOtlpAnyValue(const SXValue& value) {
  switch (value.type()) {
    case SXValue::value_t::string:
      return StringValue(value.get<std::string>());
    case SXValue::value_t::boolean:
      return {{"boolValue", value.get<bool>()}};
    case SXValue::value_t::number_integer:
      return IntValue(value.get<int64_t>());
    case SXValue::value_t::number_unsigned: {
      uint64_t number = value.get<uint64_t>();
      // Beyond int64 the exact digits matter more than the number's kind.
      if (number > uint64_t(std::numeric_limits<int64_t>::max())) {
        return StringValue(std::to_string(number));
      }
      return IntValue(static_cast<int64_t>(number));
    }
    case SXValue::value_t::number_float:
      return DoubleValue(value.get<double>());
    case SXValue::value_t::binary:
      return BytesValue(value.get_binary());
    case SXValue::value_t::array: {
      SXValue values = SXValue::array();
      for (const SXValue& element : value) values.push_back(SXOtlpAnyValue(element));
      return {{"arrayValue", {{"values", std::move(values)}}}};
    }
    case SXValue::value_t::object: {
      if (auto bytes = StoredBytes(value)) return BytesValue(*bytes);
      SXValue values = SXValue::array();
      for (const auto& [key, element] : value.items()) {
        values.push_back(KeyValue(key, SXOtlpAnyValue(element)));
      }
      return {{"kvlistValue", {{"values", std::move(values)}}}};
    }
    default:
      return SXValue::object();  // null (and anything else): an empty AnyValue
  }
}

SXValue SXOtlpLogsRequest(const std::vector<SXOtlpSpooledRow>& rows, const SXOtlpResource& resource,
                          SXDate observed) {
  std::string observedNano = std::to_string(
      std::chrono::duration_cast<std::chrono::nanoseconds>(observed.time_since_epoch()).count());
  SXValue records = SXValue::array();
  for (const SXOtlpSpooledRow& row : rows) records.push_back(LogRecord(row, observedNano));
  SXValue scopeLogs = {{"scope", {{"name", "sxreporting"}}}, {"logRecords", std::move(records)}};
  SXValue resourceLogs = {{"resource", {{"attributes", ResourceAttributes(resource)}}},
                          {"scopeLogs", SXValue::array({std::move(scopeLogs)})}};
  return {{"resourceLogs", SXValue::array({std::move(resourceLogs)})}};
}
