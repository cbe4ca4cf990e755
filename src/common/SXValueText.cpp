#include "common/SXValueText.h"

#include <algorithm>
#include <charconv>
#include <cmath>

#include "common/SXPackedValue.h"

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

  // The value `reader` is at, as `value` writes its decoded form.
  void packed(SXPackedReader& reader) {
    using Kind = SXPackedReader::Kind;
    SXPackedReader::Item item = reader.next();
    switch (item.kind) {
      case Kind::kMap:
        packedMembers(reader, item.count, false, {});
        return;
      case Kind::kArray:
        out_ += '[';
        for (uint32_t i = 0; i < item.count; ++i) {
          if (i > 0) out_ += ',';
          packed(reader);
        }
        out_ += ']';
        return;
      case Kind::kString:
        string(item.data, nullptr);
        return;
      case Kind::kUnsigned:
        decimal(item.u);
        return;
      case Kind::kSigned:
        decimal(item.i);
        return;
      case Kind::kBool:
        out_ += item.boolean ? "true" : "false";
        return;
      case Kind::kNil:
        out_ += "null";
        return;
      case Kind::kFloat:
        floating(item.f);
        return;
      case Kind::kBinary:
      case Kind::kExt: {
        const auto* bytes = reinterpret_cast<const uint8_t*>(item.data.data());
        std::vector<uint8_t> data(bytes, bytes + item.data.size());
        value(item.kind == Kind::kExt ? SXValue::binary(std::move(data),
                                                        static_cast<uint8_t>(item.extType))
                                      : SXValue::binary(std::move(data)));
        return;
      }
    }
  }

  // A dictionary of `pairs` key-value pairs that follow in `reader`, in key order with the
  // last of repeated keys, as decoding keeps them. `underscoreKeys`: each space in a key
  // becomes "_", and of keys that became equal the last in key order stays. `extra`: a member
  // added (or replacing its key's) after that.
  void packedMembers(SXPackedReader& reader, uint32_t pairs, bool underscoreKeys,
                     std::optional<SXTextMember> extra) {
    std::vector<std::pair<std::string_view, const char*>> members;  // key, where its value is
    members.reserve(pairs);
    for (uint32_t i = 0; i < pairs; ++i) {
      std::string_view key = reader.next().data;
      members.emplace_back(key, reader.position());
      reader.skip();
    }
    keepLastInKeyOrder(members);
    std::vector<std::string> renamed;  // reserved: the views into it stay valid
    if (underscoreKeys && std::any_of(members.begin(), members.end(), [](const auto& m) {
          return m.first.find(' ') != std::string_view::npos;
        })) {
      renamed.reserve(members.size());
      for (auto& [key, value] : members) {
        key = renamed.emplace_back(key);
        std::replace(renamed.back().begin(), renamed.back().end(), ' ', '_');
      }
      keepLastInKeyOrder(members);
    }
    out_ += '{';
    bool first = true;
    auto comma = [&] {
      if (!first) out_ += ',';
      first = false;
    };
    for (const auto& [key, at] : members) {
      if (extra && !(key < extra->key)) {
        comma();
        member(extra->key, *extra->value);
        bool replaced = key == extra->key;
        extra.reset();
        if (replaced) continue;
      }
      comma();
      string(key, nullptr);
      out_ += ':';
      SXPackedReader value(at, reader.end());
      packed(value);
    }
    if (extra) {
      comma();
      member(extra->key, *extra->value);
    }
    out_ += '}';
  }

 private:
  // Sorts by key, keeping of equal keys the one that came last.
  static void keepLastInKeyOrder(std::vector<std::pair<std::string_view, const char*>>& members) {
    // Clients nearly always pack their keys in order, once each.
    if (std::adjacent_find(members.begin(), members.end(), [](const auto& a, const auto& b) {
          return !(a.first < b.first);
        }) == members.end()) {
      return;
    }
    std::stable_sort(members.begin(), members.end(),
                     [](const auto& a, const auto& b) { return a.first < b.first; });
    auto kept = members.begin();
    for (auto it = members.begin(); it != members.end(); ++it) {
      if (std::next(it) != members.end() && std::next(it)->first == it->first) continue;
      *kept++ = *it;
    }
    members.erase(kept, members.end());
  }

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

std::string SXPackedDictionaryText(const SXPackedValue& packed, bool underscoreKeys,
                                   std::optional<SXTextMember> member) {
  if (!packed.isDictionary()) {
    if (!underscoreKeys && !member) return SXValueText(packed.value());
    std::string text = "{";
    if (member) JsonWriter(text).member(member->key, *member->value);
    return text += '}';
  }
  std::string text;
  text.reserve(packed.size() * 3 / 2 + 16);
  SXPackedReader reader(packed.bytes());
  uint32_t pairs = reader.next().count;
  JsonWriter(text).packedMembers(reader, pairs, underscoreKeys, member);
  return text;
}
