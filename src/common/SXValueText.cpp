#include "common/SXValueText.h"

#include <algorithm>
#include <array>
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
    struct Member {
      std::string_view key;
      const char* value;  // where its value starts in the bytes
    };
    // Dictionaries of a few keys, nearly all of them, are sorted without the heap.
    constexpr uint32_t kInline = 32;
    Member inlineMembers[kInline];
    std::vector<Member> heapMembers;
    Member* members = inlineMembers;
    if (pairs > kInline) {
      heapMembers.resize(pairs);
      members = heapMembers.data();
    }
    const KeyOrder order{underscoreKeys};
    // In renamed order, then original order, then the order of the bytes: the last of each
    // run of equal renamed keys is the one decoding and renaming keep. Insertion sort is
    // stable and quick for the few keys of a message.
    for (uint32_t i = 0; i < pairs; ++i) {
      Member member{reader.next().data, reader.position()};
      reader.skip();
      uint32_t at = i;
      for (; at > 0 && order.before(member.key, members[at - 1].key); --at) {
        members[at] = members[at - 1];
      }
      members[at] = member;
    }
    out_ += '{';
    bool first = true;
    auto comma = [&] {
      if (!first) out_ += ',';
      first = false;
    };
    for (uint32_t i = 0; i < pairs; ++i) {
      const std::string_view key = members[i].key;
      if (i + 1 < pairs && order.renamedEqual(key, members[i + 1].key)) continue;
      if (extra && !order.renamedBelow(key, extra->key)) {
        comma();
        member(extra->key, *extra->value);
        bool replaced = !order.renamedBelow(extra->key, key);
        extra.reset();
        if (replaced) continue;
      }
      comma();
      if (underscoreKeys && key.find(' ') != std::string_view::npos) {
        std::string renamed(key);
        std::replace(renamed.begin(), renamed.end(), ' ', '_');
        string(renamed, nullptr);
      } else {
        string(key, nullptr);
      }
      out_ += ':';
      SXPackedReader value(members[i].value, reader.end());
      packed(value);
    }
    if (extra) {
      comma();
      member(extra->key, *extra->value);
    }
    out_ += '}';
  }

 private:
  // Key comparisons as if every space were "_" when `underscore` is set, byte by byte as
  // std::string compares.
  struct KeyOrder {
    bool underscore;

    unsigned char renamed(char c) const {
      return static_cast<unsigned char>(underscore && c == ' ' ? '_' : c);
    }
    int renamedCompare(std::string_view a, std::string_view b) const {
      size_t n = std::min(a.size(), b.size());
      for (size_t i = 0; i < n; ++i) {
        if (renamed(a[i]) != renamed(b[i])) return renamed(a[i]) < renamed(b[i]) ? -1 : 1;
      }
      return a.size() == b.size() ? 0 : (a.size() < b.size() ? -1 : 1);
    }
    bool renamedBelow(std::string_view a, std::string_view b) const {
      return renamedCompare(a, b) < 0;
    }
    bool renamedEqual(std::string_view a, std::string_view b) const {
      return renamedCompare(a, b) == 0;
    }
    bool before(std::string_view a, std::string_view b) const {
      int c = renamedCompare(a, b);
      return c < 0 || (c == 0 && a < b);
    }
  };

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
    static constexpr auto kPlain = [] {
      std::array<bool, 256> table{};
      for (int c = 0x20; c < 0x7F; ++c) table[c] = c != '"' && c != '\\';
      return table;
    }();
    for (unsigned char c : text) {
      if (!kPlain[c]) return false;
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
