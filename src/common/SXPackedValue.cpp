#include "common/SXPackedValue.h"

#include <cstring>
#include <limits>
#include <stdexcept>

#include "common/MsgpackValue.h"

void SXCheckValueModel(const msgpack::object& o, int maxDepth) {
  using msgpack::type::object_type;
  if (o.type != object_type::ARRAY && o.type != object_type::MAP) return;
  if (maxDepth <= 0) throw SXValueConversionError("value nested too deeply");
  if (o.type == object_type::ARRAY) {
    for (uint32_t i = 0; i < o.via.array.size; ++i) {
      SXCheckValueModel(o.via.array.ptr[i], maxDepth - 1);
    }
    return;
  }
  for (uint32_t i = 0; i < o.via.map.size; ++i) {
    const auto& kv = o.via.map.ptr[i];
    if (kv.key.type != object_type::STR) {
      throw SXValueConversionError("dictionary key is not a string");
    }
    SXCheckValueModel(kv.val, maxDepth - 1);
  }
}

SXPackedValue SXPackedValue::fromValue(const SXValue& value) {
  std::string bytes;
  SXStringSink sink{&bytes};
  msgpack::packer<SXStringSink> packer(sink);
  SXPackValue(packer, value);
  return SXPackedValue(std::move(bytes));
}

bool SXPackedValue::isDictionary() const {
  if (bytes_.empty()) return false;
  auto first = static_cast<uint8_t>(bytes_[0]);
  return (first >= 0x80 && first <= 0x8f) || first == 0xde || first == 0xdf;
}

bool SXPackedValue::hasMember(std::string_view key) const {
  if (!isDictionary()) return false;
  SXPackedReader reader(bytes_);
  uint32_t pairs = reader.next().count;
  for (uint32_t i = 0; i < pairs; ++i) {
    if (reader.next().data == key) return true;
    reader.skip();
  }
  return false;
}

SXValue SXPackedValue::value() const {
  msgpack::object_handle handle = msgpack::unpack(bytes_.data(), bytes_.size());
  // The depth was checked when the bytes were made.
  return SXValueFromMsgpack(handle.get(), std::numeric_limits<int>::max());
}

const char* SXPackedReader::take(size_t n) {
  if (static_cast<size_t>(end_ - at_) < n) [[unlikely]] {
    if (onEnd_ == OnEnd::kThrow) throw std::out_of_range("MessagePack ends early");
    // Zeros for what is read of this item: a nil head, empty sizes. Its data is not to be read.
    static constexpr char kZeros[8] = {};
    endedEarly_ = true;
    at_ = end_;
    return kZeros;
  }
  const char* at = at_;
  at_ += n;
  return at;
}

// A big-endian number of `n` bytes.
template <typename T>
T SXPackedReader::big(size_t n) {
  const auto* bytes = reinterpret_cast<const uint8_t*>(take(n));
  uint64_t value = 0;
  for (size_t i = 0; i < n; ++i) value = value << 8 | bytes[i];
  return static_cast<T>(value);
}

SXPackedReader::Item SXPackedReader::nextOther() {
  Item item;
  auto head = static_cast<uint8_t>(*take(1));
  auto sized = [&](Kind kind, size_t size) {
    item.kind = kind;
    item.data = std::string_view(take(size), size);
  };
  auto ext = [&](size_t size) {
    item.kind = Kind::kExt;
    item.extType = static_cast<int8_t>(*take(1));
    item.data = std::string_view(take(size), size);
  };
  auto container = [&](Kind kind, uint32_t count) {
    item.kind = kind;
    item.count = count;
  };
  auto integer = [&](int64_t value) {
    if (value < 0) {
      item.kind = Kind::kSigned;
      item.i = value;
    } else {
      item.kind = Kind::kUnsigned;
      item.u = static_cast<uint64_t>(value);
    }
  };
  if (head <= 0x7f) {
    integer(head);
  } else if (head <= 0x8f) {
    container(Kind::kMap, head & 0x0f);
  } else if (head <= 0x9f) {
    container(Kind::kArray, head & 0x0f);
  } else if (head <= 0xbf) {
    sized(Kind::kString, head & 0x1f);
  } else if (head >= 0xe0) {
    integer(static_cast<int8_t>(head));
  } else {
    // clang-format off
    switch (head) {
      case 0xc0: item.kind = Kind::kNil; break;
      case 0xc2: case 0xc3: item.kind = Kind::kBool; item.boolean = head == 0xc3; break;
      case 0xc4: sized(Kind::kBinary, big<uint8_t>(1)); break;
      case 0xc5: sized(Kind::kBinary, big<uint16_t>(2)); break;
      case 0xc6: sized(Kind::kBinary, big<uint32_t>(4)); break;
      case 0xc7: ext(big<uint8_t>(1)); break;
      case 0xc8: ext(big<uint16_t>(2)); break;
      case 0xc9: ext(big<uint32_t>(4)); break;
      case 0xca: {
        auto raw = big<uint32_t>(4);
        float value;
        std::memcpy(&value, &raw, sizeof value);
        item.kind = Kind::kFloat;
        item.f = value;
        break;
      }
      case 0xcb: {
        auto raw = big<uint64_t>(8);
        std::memcpy(&item.f, &raw, sizeof item.f);
        item.kind = Kind::kFloat;
        break;
      }
      case 0xcc: integer(big<uint8_t>(1)); break;
      case 0xcd: integer(big<uint16_t>(2)); break;
      case 0xce: integer(big<uint32_t>(4)); break;
      case 0xcf: item.kind = Kind::kUnsigned; item.u = big<uint64_t>(8); break;
      case 0xd0: integer(big<int8_t>(1)); break;
      case 0xd1: integer(big<int16_t>(2)); break;
      case 0xd2: integer(big<int32_t>(4)); break;
      case 0xd3: integer(big<int64_t>(8)); break;
      case 0xd4: ext(1); break;
      case 0xd5: ext(2); break;
      case 0xd6: ext(4); break;
      case 0xd7: ext(8); break;
      case 0xd8: ext(16); break;
      case 0xd9: sized(Kind::kString, big<uint8_t>(1)); break;
      case 0xda: sized(Kind::kString, big<uint16_t>(2)); break;
      case 0xdb: sized(Kind::kString, big<uint32_t>(4)); break;
      case 0xdc: container(Kind::kArray, big<uint16_t>(2)); break;
      case 0xdd: container(Kind::kArray, big<uint32_t>(4)); break;
      case 0xde: container(Kind::kMap, big<uint16_t>(2)); break;
      case 0xdf: container(Kind::kMap, big<uint32_t>(4)); break;
      default: throw std::out_of_range("not MessagePack");  // 0xc1, never used
    }
    // clang-format on
  }
  return endedEarly_ ? Item() : item;
}

void SXPackedReader::skip() {
  // Containers are counted down instead of recursed into: nesting costs no stack.
  uint64_t left = 1;
  while (left > 0) {
    --left;
    Item item = next();
    if (item.kind == Kind::kArray) left += item.count;
    if (item.kind == Kind::kMap) left += 2 * uint64_t{item.count};
  }
}
