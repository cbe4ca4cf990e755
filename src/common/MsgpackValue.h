// Conversion between MessagePack objects and the value model.
#pragma once

#include <cstring>
#include <msgpack.hpp>
#include <stdexcept>
#include <string>

#include "sxreporting/types.h"

// Thrown when a MessagePack object has no place in the value model (a dictionary key that is
// not a string) or nests deeper than allowed.
class SXValueConversionError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// Converts a decoded object. Dictionaries need string keys; binary and ext become binary
// values (ext keeps its type as subtype); float32 widens to double.
SXValue SXValueFromMsgpack(const msgpack::object& object, int maxDepth = 32);

// A packer stream that appends to a string, so that encoded replies can go straight into a
// connection's output without an intermediate buffer.
struct SXStringSink {
  std::string* out;
  void write(const char* data, size_t size) { out->append(data, size); }
};

// Packs a double as a float64 even when it is whole: msgpack-c's pack_double writes 12.0 and
// -0.0 as integers, and a floating value must reach its reader as one.
template <typename Stream>
void SXPackDouble(msgpack::packer<Stream>& packer, double value) {
  uint64_t bits;
  std::memcpy(&bits, &value, sizeof bits);
  char bytes[9] = {static_cast<char>(0xcb)};
  for (int i = 0; i < 8; ++i) bytes[1 + i] = static_cast<char>(bits >> (56 - 8 * i));
  packer.pack_str_body(bytes, sizeof bytes);  // appends the bytes as they are
}

// Packs a value. Binary values pack as bin (or ext when they carry a subtype); floating values
// as float64.
template <typename Stream>
void SXPackValue(msgpack::packer<Stream>& packer, const SXValue& value);

extern template void SXPackValue(msgpack::packer<msgpack::sbuffer>&, const SXValue&);
extern template void SXPackValue(msgpack::packer<SXStringSink>&, const SXValue&);

// The number of bytes `SXPackValue` writes for `value`.
size_t SXPackedSize(const SXValue& value);
