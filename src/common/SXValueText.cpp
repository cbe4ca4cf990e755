#include "common/SXValueText.h"

#include <charconv>

std::string SXDoubleText(double value) {
  char buf[64];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, value);
  return ec == std::errc() ? std::string(buf, end) : std::string("nan");
}

std::string SXValueText(const SXValue& value) {
  switch (value.type()) {
    case SXValue::value_t::null:
      return "(null)";
    case SXValue::value_t::string:
      return value.get_ref<const std::string&>();
    case SXValue::value_t::boolean:
      return value.get<bool>() ? "1" : "0";
    case SXValue::value_t::number_integer:
      return std::to_string(value.get<int64_t>());
    case SXValue::value_t::number_unsigned:
      return std::to_string(value.get<uint64_t>());
    case SXValue::value_t::number_float:
      return SXDoubleText(value.get<double>());
    default:
      // Invalid UTF-8 inside a client's strings must not stop a log line or a summary.
      return value.dump(-1, ' ', false, SXValue::error_handler_t::replace);
  }
}

std::string SXValueTextWithMember(const SXValue& dictionary, const std::string& key,
                                  const SXValue& value) {
  std::string text = "{";
  // The serializer SXValue::dump uses, writing straight into `text`.
  nlohmann::detail::serializer<SXValue> serializer(
      nlohmann::detail::output_adapter<char, std::string>(text), ' ',
      SXValue::error_handler_t::replace);
  bool first = true;
  auto member = [&](const std::string& name, const SXValue& member) {
    if (!first) text += ',';
    first = false;
    serializer.dump(SXValue(name), false, false, 0);
    text += ':';
    serializer.dump(member, false, false, 0);
  };
  bool placed = false;
  if (dictionary.is_object()) {
    // Members come in key order, as in the dump of the merged dictionary.
    for (const auto& [name, member_value] : dictionary.items()) {
      if (!placed && !(name < key)) {
        member(key, value);
        placed = true;
        if (name == key) continue;
      }
      member(name, member_value);
    }
  }
  if (!placed) member(key, value);
  text += '}';
  return text;
}
