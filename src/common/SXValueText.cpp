#include "common/SXValueText.h"

#include <algorithm>
#include <charconv>
#include <cmath>

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
  explicit JsonWriter(std::string& out) : out_(out) {}

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
      case SXValue::value_t::number_integer:
        decimal(value.get<int64_t>());
        return;
      case SXValue::value_t::number_unsigned:
        decimal(value.get<uint64_t>());
        return;
      case SXValue::value_t::boolean:
        out_ += value.get<bool>() ? "true" : "false";
        return;
      case SXValue::value_t::null:
        out_ += "null";
        return;
      case SXValue::value_t::number_float:
        floating(value.get<double>());
        return;
      default:
        serializer().dump(value, false, false, 0);
    }
  }

  void member(std::string_view key, const SXValue& value) {
    string(key, nullptr);
    out_ += ':';
    this->value(value);
  }

 private:
  template <typename Integer>
  void decimal(Integer number) {
    char digits[24];
    auto [end, ec] = std::to_chars(digits, digits + sizeof digits, number);
    out_.append(digits, end);
  }

  // The library's own shortest form, as its serializer writes it; not a number is null.
  void floating(double number) {
    if (!std::isfinite(number)) {
      out_ += "null";
      return;
    }
    char digits[64];
    char* end = nlohmann::detail::to_chars(digits, digits + sizeof digits, number);
    out_.append(digits, end);
  }

  // The library's serializer, for binary values and strings that need escaping or repair.
  // Made on first use: setting one up costs more than writing a payload.
  nlohmann::detail::serializer<SXValue>& serializer() {
    if (!serializer_) {
      serializer_.emplace(nlohmann::detail::output_adapter<char, std::string>(out_), ' ',
                          SXValue::error_handler_t::replace);
    }
    return *serializer_;
  }

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
      serializer().dump(*asValue, false, false, 0);
    } else {
      serializer().dump(SXValue(std::string(text)), false, false, 0);
    }
  }

  std::string& out_;
  std::optional<nlohmann::detail::serializer<SXValue>> serializer_;
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

namespace {

// The index just past the string whose opening quote is at `at`, or npos. The closing quote is
// the first one after an even run of backslashes; memchr finds the candidates.
size_t SkipJsonString(std::string_view text, size_t at) {
  for (size_t from = at + 1;;) {
    size_t quote = text.find('"', from);
    if (quote == std::string_view::npos) return quote;
    size_t backslashes = 0;
    while (quote - backslashes > at + 1 && text[quote - 1 - backslashes] == '\\') ++backslashes;
    if (backslashes % 2 == 0) return quote + 1;
    from = quote + 1;
  }
}

// The index just past the JSON value that starts at `at` in compact JSON text, or npos.
size_t SkipJsonValue(std::string_view text, size_t at) {
  int depth = 0;
  for (size_t i = at; i < text.size(); ++i) {
    char c = text[i];
    if (c == '"') {
      i = SkipJsonString(text, i);
      if (i == std::string_view::npos) return i;
      if (depth == 0) return i;
      --i;  // the loop steps past the closing quote
    } else if (c == '{' || c == '[') {
      ++depth;
    } else if (c == '}' || c == ']') {
      if (depth == 0) return i;  // the end of the dictionary: a number or a literal ended
      if (--depth == 0) return i + 1;
    } else if (c == ',' && depth == 0) {
      return i;
    }
  }
  return std::string_view::npos;
}

}  // namespace

std::optional<SXTextSlices> SXDictionaryTextMembers(std::string_view text) {
  if (text.size() < 2 || text.front() != '{' || text.back() != '}') return std::nullopt;
  SXTextSlices members;
  const size_t end = text.size() - 1;
  for (size_t at = 1; at < end;) {
    if (text[at] != '"') return std::nullopt;
    size_t close = text.find('"', at + 1);
    if (close == std::string_view::npos || close + 1 >= end || text[close + 1] != ':') {
      return std::nullopt;
    }
    std::string_view name = text.substr(at + 1, close - at - 1);
    if (name.find('\\') != std::string_view::npos) return std::nullopt;
    size_t next = SkipJsonValue(text, close + 2);
    if (next == std::string_view::npos || next > end) return std::nullopt;
    if (next < end && text[next] != ',') return std::nullopt;
    members.emplace_back(name, text.substr(close + 2, next - close - 2));
    at = next + 1;
  }
  return members;
}

std::optional<std::string> SXDictionaryTextWithMember(std::string_view text, const std::string& key,
                                                      const SXValue& value) {
  auto members = SXDictionaryTextMembers(text);
  if (!members) return std::nullopt;
  const SXTextMember only[] = {{key, &value}};
  const std::string single = SXDictionaryText(only);
  const std::string_view member = std::string_view(single).substr(1, single.size() - 2);
  std::string out;
  out.reserve(text.size() + member.size() + 1);
  // Members come in key order: the new one goes before the first key not below it.
  auto next = std::find_if(members->begin(), members->end(),
                           [&](const auto& slice) { return !(slice.first < key); });
  if (next == members->end()) {
    out.append(text.substr(0, text.size() - 1));
    if (!members->empty()) out += ',';
    return out.append(member).append("}");
  }
  const size_t start = static_cast<size_t>(next->first.data() - text.data()) - 1;  // its quote
  out.append(text.substr(0, start)).append(member);
  if (next->first == key) {
    const std::string_view& replaced = next->second;
    out.append(text.substr(static_cast<size_t>(replaced.data() + replaced.size() - text.data())));
  } else {
    out.append(",").append(text.substr(start));
  }
  return out;
}
