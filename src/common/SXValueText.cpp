#include "common/SXValueText.h"

#include <charconv>

std::string SXDoubleText(double value) {
  char buf[64];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, value);
  return ec == std::errc() ? std::string(buf, end) : std::string("nan");
}

namespace {

// Compact JSON as SXValue::dump(-1) writes it, with invalid UTF-8 replaced. Keys and strings
// of plain ASCII, nearly all of them in practice, are copied as they are; everything else goes
// through the library's serializer, so the text is the same byte for byte.
class JsonWriter {
 public:
  explicit JsonWriter(std::string& out)
      : out_(out),
        serializer_(nlohmann::detail::output_adapter<char, std::string>(out), ' ',
                    SXValue::error_handler_t::replace) {}

  void value(const SXValue& value) {
    switch (value.type()) {
      case SXValue::value_t::object: {
        out_ += '{';
        bool first = true;
        for (auto it = value.cbegin(); it != value.cend(); ++it) {
          if (!first) out_ += ',';
          first = false;
          member(it.key(), it.value());
        }
        out_ += '}';
        return;
      }
      case SXValue::value_t::array: {
        out_ += '[';
        bool first = true;
        for (const SXValue& element : value) {
          if (!first) out_ += ',';
          first = false;
          this->value(element);
        }
        out_ += ']';
        return;
      }
      case SXValue::value_t::string:
        string(value.get_ref<const std::string&>(), &value);
        return;
      default:
        serializer_.dump(value, false, false, 0);
    }
  }

  void member(std::string_view key, const SXValue& value) {
    string(key, nullptr);
    out_ += ':';
    this->value(value);
  }

 private:
  static bool plain(std::string_view text) {
    for (unsigned char c : text) {
      if (c < 0x20 || c >= 0x7F || c == '"' || c == '\\') return false;
    }
    return true;
  }

  // `asValue`: the same string as a value, when the caller has one (saves a copy).
  void string(std::string_view text, const SXValue* asValue) {
    if (plain(text)) {
      out_ += '"';
      out_.append(text);
      out_ += '"';
    } else if (asValue) {
      serializer_.dump(*asValue, false, false, 0);
    } else {
      serializer_.dump(SXValue(std::string(text)), false, false, 0);
    }
  }

  std::string& out_;
  nlohmann::detail::serializer<SXValue> serializer_;
};

std::string JsonText(const SXValue& value) {
  std::string text;
  JsonWriter(text).value(value);
  return text;
}

}  // namespace

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
      return JsonText(value);
  }
}

std::string SXDictionaryText(std::span<const SXTextMember> members) {
  std::string text = "{";
  JsonWriter writer(text);
  bool first = true;
  for (const SXTextMember& member : members) {
    if (!first) text += ',';
    first = false;
    writer.member(member.key, *member.value);
  }
  text += '}';
  return text;
}

std::string SXValueTextWithMember(const SXValue& dictionary, const std::string& key,
                                  const SXValue& value) {
  std::string text = "{";
  JsonWriter writer(text);
  bool first = true;
  auto member = [&](const std::string& name, const SXValue& member) {
    if (!first) text += ',';
    first = false;
    writer.member(name, member);
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
