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
