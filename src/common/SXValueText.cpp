#include "common/SXValueText.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>

#include "common/SXPackedValue.h"

std::string SXDoubleText(double value) {
  char buf[64];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, value);
  return ec == std::errc() ? std::string(buf, end) : std::string("nan");
}

namespace {

// Appends to a string through a cursor: the string is grown ahead of the writes and cut to
// length once, in finish(), so each piece of a text is a plain copy, not a checked append.
class TextBuffer {
 public:
  explicit TextBuffer(std::string& out) : out_(out), length_(out.size()) {
    out_.resize(std::max(out_.capacity(), length_ + kSlack));
  }

  // Room for `n` more bytes after what is written; wrote() then says how many were used.
  char* room(size_t n) {
    if (out_.size() - length_ < n) [[unlikely]] {
      grow(n);
    }
    return out_.data() + length_;
  }
  void wrote(size_t n) { length_ += n; }

  void put(char c) {
    *room(1) = c;
    ++length_;
  }
  void put(std::string_view text) {
    if (text.empty()) return;
    std::memcpy(room(text.size()), text.data(), text.size());
    length_ += text.size();
  }

  void finish() { out_.resize(length_); }

 private:
  static constexpr size_t kSlack = 64;

  [[gnu::noinline]] void grow(size_t n) {
    out_.resize(std::max(2 * out_.size(), length_ + n + kSlack));
  }

  std::string& out_;
  size_t length_;
};

// Whether the 16 bytes at `bytes` are printable ASCII other than '"' and '\\'.
bool PlainBlock(const char* bytes) {
  using Block = uint8_t __attribute__((vector_size(16)));
  Block block;
  std::memcpy(&block, bytes, sizeof block);
  auto bad = (block < 0x20) | (block >= 0x7F) | (block == '"') | (block == '\\');
  uint64_t halves[2];
  std::memcpy(halves, &bad, sizeof halves);
  return (halves[0] | halves[1]) == 0;
}

// The same of the 8 bytes at `bytes`, in one word.
bool PlainWord(const char* bytes) {
  constexpr uint64_t kOnes = 0x0101010101010101;
  constexpr uint64_t kHighs = 0x8080808080808080;
  // Whether a byte of `word` is below `n` (at most 0x80), or equal to `c`.
  auto below = [](uint64_t word, uint64_t n) { return (word - kOnes * n) & ~word & kHighs; };
  auto equal = [&](uint64_t word, uint64_t c) { return below(word ^ (kOnes * c), 1); };
  uint64_t word;
  std::memcpy(&word, bytes, sizeof word);
  return ((word & kHighs) | below(word, 0x20) | equal(word, 0x7F) | equal(word, '"') |
          equal(word, '\\')) == 0;
}

// Each space in the `size` bytes at `text` made "_", 16 bytes at a time.
void UnderscoreSpaces(char* text, size_t size) {
  using Block = uint8_t __attribute__((vector_size(16)));
  size_t at = 0;
  for (; at + sizeof(Block) <= size; at += sizeof(Block)) {
    Block block;
    std::memcpy(&block, text + at, sizeof block);
    block += reinterpret_cast<Block>(block == ' ') & ('_' - ' ');
    std::memcpy(text + at, &block, sizeof block);
  }
  for (; at < size; ++at) {
    if (text[at] == ' ') text[at] = '_';
  }
}

// Whether JSON writes `text` as it is: printable ASCII other than '"' and '\\'. A block at a
// time, the last one overlapping the one before: nearly every key and string of a payload is
// such a text.
bool plain(std::string_view text) {
  const char* bytes = text.data();
  const size_t size = text.size();
  if (size >= 16) {
    for (size_t at = 0; at + 16 < size; at += 16) {
      if (!PlainBlock(bytes + at)) return false;
    }
    return PlainBlock(bytes + size - 16);
  }
  if (size >= 8) return PlainWord(bytes) && PlainWord(bytes + size - 8);
  for (size_t at = 0; at < size; ++at) {
    auto c = static_cast<unsigned char>(bytes[at]);
    if (c < 0x20 || c >= 0x7F || c == '"' || c == '\\') return false;
  }
  return true;
}

// Compact JSON as SXValue::dump(-1) writes it, with invalid UTF-8 replaced. Keys and strings
// of plain ASCII, nearly all of them in practice, are copied as they are; everything else goes
// through the library's serializer, so the text is the same byte for byte.
class JsonWriter {
 public:
  explicit JsonWriter(std::string& out) : out_(out) {}
  ~JsonWriter() { out_.finish(); }
  JsonWriter(const JsonWriter&) = delete;
  JsonWriter& operator=(const JsonWriter&) = delete;

  void value(const SXValue& value) {
    switch (value.type()) {
      case SXValue::value_t::object: {
        out_.put('{');
        bool first = true;
        for (auto it = value.cbegin(); it != value.cend(); ++it) {
          if (!first) out_.put(',');
          first = false;
          member(it.key(), it.value());
        }
        out_.put('}');
        return;
      }
      case SXValue::value_t::array: {
        out_.put('[');
        bool first = true;
        for (const SXValue& element : value) {
          if (!first) out_.put(',');
          first = false;
          this->value(element);
        }
        out_.put(']');
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
        out_.put(value.get<bool>() ? "true" : "false");
        return;
      case SXValue::value_t::null:
        out_.put("null");
        return;
      case SXValue::value_t::number_float:
        floating(value.get<double>());
        return;
      default:
        dump(value);
    }
  }

  void member(std::string_view key, const SXValue& value) {
    string(key, nullptr);
    out_.put(':');
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
        out_.put('[');
        for (uint32_t i = 0; i < item.count; ++i) {
          if (i > 0) out_.put(',');
          packed(reader);
        }
        out_.put(']');
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
        out_.put(item.boolean ? "true" : "false");
        return;
      case Kind::kNil:
        out_.put("null");
        return;
      case Kind::kFloat:
        floating(item.f);
        return;
      case Kind::kBinary:
      case Kind::kExt: {
        const auto* bytes = reinterpret_cast<const uint8_t*>(item.data.data());
        std::vector<uint8_t> data(bytes, bytes + item.data.size());
        value(item.kind == Kind::kExt
                  ? SXValue::binary(std::move(data), static_cast<uint8_t>(item.extType))
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
      // Not a string_view: that would zero the whole inline array up front.
      const char* keyBytes;
      size_t keySize;
      const char* value;  // where its value starts in the bytes
      std::string_view key() const { return {keyBytes, keySize}; }
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
    for (uint32_t i = 0; i < pairs; ++i) {
      std::string_view key = reader.next().data;
      members[i] = {key.data(), key.size(), reader.position()};
      reader.skip();
    }
    // In renamed order, then original order, then the order of the bytes: the last of each
    // run of equal renamed keys is the one decoding and renaming keep.
    const KeyOrder order{underscoreKeys};
    auto before = [&](const Member& a, const Member& b) { return order.before(a.key(), b.key()); };
    if (pairs > kInline) {
      std::stable_sort(members, members + pairs, before);
    } else {
      // Insertion sort, stable and quick for the few keys of a message.
      for (uint32_t i = 1; i < pairs; ++i) {
        Member member = members[i];
        uint32_t at = i;
        for (; at > 0 && before(member, members[at - 1]); --at) members[at] = members[at - 1];
        members[at] = member;
      }
    }
    out_.put('{');
    bool first = true;
    auto comma = [&] {
      if (!first) out_.put(',');
      first = false;
    };
    for (uint32_t i = 0; i < pairs; ++i) {
      const std::string_view key = members[i].key();
      if (i + 1 < pairs && order.renamedEqual(key, members[i + 1].key())) continue;
      if (extra && !order.renamedBelow(key, extra->key)) {
        comma();
        member(extra->key, *extra->value);
        bool replaced = !order.renamedBelow(extra->key, key);
        extra.reset();
        if (replaced) continue;
      }
      comma();
      string(key, nullptr, underscoreKeys);
      out_.put(':');
      SXPackedReader value(members[i].value, reader.end());
      packed(value);
    }
    if (extra) {
      comma();
      member(extra->key, *extra->value);
    }
    out_.put('}');
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
    constexpr size_t kDigits = 24;
    char* at = out_.room(kDigits);
    out_.wrote(std::to_chars(at, at + kDigits, number).ptr - at);
  }

  // The library's own shortest form, as its serializer writes it; not a number is null.
  void floating(double number) {
    if (!std::isfinite(number)) {
      out_.put("null");
      return;
    }
    constexpr size_t kDigits = 64;
    char* at = out_.room(kDigits);
    out_.wrote(nlohmann::detail::to_chars(at, at + kDigits, number) - at);
  }

  // The library's serializer, for binary values and strings that need escaping or repair.
  // Made on first use: setting one up costs more than writing a payload.
  void dump(const SXValue& value) {
    if (!serializer_) {
      serializer_.emplace(nlohmann::detail::output_adapter<char, std::string>(dumped_), ' ',
                          SXValue::error_handler_t::replace);
    }
    dumped_.clear();
    serializer_->dump(value, false, false, 0);
    out_.put(dumped_);
  }

  // `asValue`: the same string as a value, when the caller has one (saves a copy).
  // `underscore`: each space written as "_".
  void string(std::string_view text, const SXValue* asValue, bool underscore = false) {
    if (plain(text)) {
      char* at = out_.room(text.size() + 2);
      *at = '"';
      if (!text.empty()) std::memcpy(at + 1, text.data(), text.size());
      if (underscore) UnderscoreSpaces(at + 1, text.size());
      at[text.size() + 1] = '"';
      out_.wrote(text.size() + 2);
    } else if (underscore) {
      std::string renamed(text);
      UnderscoreSpaces(renamed.data(), renamed.size());
      dump(SXValue(std::move(renamed)));
    } else if (asValue) {
      dump(*asValue);
    } else {
      dump(SXValue(std::string(text)));
    }
  }

  TextBuffer out_;
  std::string dumped_;
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
