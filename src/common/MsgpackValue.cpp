#include "common/MsgpackValue.h"

namespace {

SXValue convert(const msgpack::object& o, int depthLeft) {
  using msgpack::type::object_type;
  switch (o.type) {
    case object_type::NIL:
      return nullptr;
    case object_type::BOOLEAN:
      return o.via.boolean;
    case object_type::POSITIVE_INTEGER:
      return o.via.u64;
    case object_type::NEGATIVE_INTEGER:
      return o.via.i64;
    case object_type::FLOAT32:
    case object_type::FLOAT64:
      return o.via.f64;
    case object_type::STR:
      return std::string(o.via.str.ptr, o.via.str.size);
    case object_type::BIN: {
      SXValue::binary_t bytes(std::vector<uint8_t>(o.via.bin.ptr, o.via.bin.ptr + o.via.bin.size));
      return SXValue::binary(std::move(bytes));
    }
    case object_type::EXT: {
      const auto* data = reinterpret_cast<const uint8_t*>(o.via.ext.data());
      return SXValue::binary(std::vector<uint8_t>(data, data + o.via.ext.size),
                             static_cast<uint8_t>(o.via.ext.type()));
    }
    case object_type::ARRAY: {
      if (depthLeft <= 0) throw SXValueConversionError("value nested too deeply");
      SXValue array = SXValue::array();
      auto& items = array.get_ref<SXValue::array_t&>();
      items.reserve(o.via.array.size);
      for (uint32_t i = 0; i < o.via.array.size; ++i) {
        items.push_back(convert(o.via.array.ptr[i], depthLeft - 1));
      }
      return array;
    }
    case object_type::MAP: {
      if (depthLeft <= 0) throw SXValueConversionError("value nested too deeply");
      SXValue object = SXValue::object();
      auto& members = object.get_ref<SXValue::object_t&>();
      for (uint32_t i = 0; i < o.via.map.size; ++i) {
        const auto& kv = o.via.map.ptr[i];
        if (kv.key.type != object_type::STR) {
          throw SXValueConversionError("dictionary key is not a string");
        }
        std::string key(kv.key.via.str.ptr, kv.key.via.str.size);
        // Clients pack dictionaries in key order: each key then goes last, with no search.
        if (members.empty() || std::prev(members.end())->first < key) {
          members.emplace_hint(members.end(), std::move(key), convert(kv.val, depthLeft - 1));
        } else {
          members[std::move(key)] = convert(kv.val, depthLeft - 1);  // a repeat: the last wins
        }
      }
      return object;
    }
  }
  throw SXValueConversionError("unknown MessagePack type");
}

}  // namespace

SXValue SXValueFromMsgpack(const msgpack::object& object, int maxDepth) {
  return convert(object, maxDepth);
}

template <typename Stream>
void SXPackValue(msgpack::packer<Stream>& p, const SXValue& v) {
  switch (v.type()) {
    case SXValue::value_t::null:
    case SXValue::value_t::discarded:
      p.pack_nil();
      break;
    case SXValue::value_t::boolean:
      v.get<bool>() ? p.pack_true() : p.pack_false();
      break;
    case SXValue::value_t::number_integer:
      p.pack_int64(v.get<int64_t>());
      break;
    case SXValue::value_t::number_unsigned:
      p.pack_uint64(v.get<uint64_t>());
      break;
    case SXValue::value_t::number_float:
      SXPackDouble(p, v.get<double>());
      break;
    case SXValue::value_t::string: {
      const auto& s = v.get_ref<const std::string&>();
      p.pack_str(static_cast<uint32_t>(s.size()));
      p.pack_str_body(s.data(), static_cast<uint32_t>(s.size()));
      break;
    }
    case SXValue::value_t::binary: {
      const auto& b = v.get_binary();
      auto size = static_cast<uint32_t>(b.size());
      const char* data = reinterpret_cast<const char*>(b.data());
      if (b.has_subtype()) {
        p.pack_ext(size, static_cast<int8_t>(b.subtype()));
        p.pack_ext_body(data, size);
      } else {
        p.pack_bin(size);
        p.pack_bin_body(data, size);
      }
      break;
    }
    case SXValue::value_t::array:
      p.pack_array(static_cast<uint32_t>(v.size()));
      for (const auto& item : v) SXPackValue(p, item);
      break;
    case SXValue::value_t::object:
      p.pack_map(static_cast<uint32_t>(v.size()));
      for (const auto& [key, item] : v.items()) {
        p.pack_str(static_cast<uint32_t>(key.size()));
        p.pack_str_body(key.data(), static_cast<uint32_t>(key.size()));
        SXPackValue(p, item);
      }
      break;
  }
}

template void SXPackValue(msgpack::packer<msgpack::sbuffer>&, const SXValue&);
template void SXPackValue(msgpack::packer<SXStringSink>&, const SXValue&);

namespace {
struct SXCountingSink {
  size_t bytes = 0;
  void write(const char*, size_t size) { bytes += size; }
};
}  // namespace

size_t SXPackedSize(const SXValue& value) {
  SXCountingSink sink;
  msgpack::packer<SXCountingSink> packer(sink);
  SXPackValue(packer, value);
  return sink.bytes;
}
