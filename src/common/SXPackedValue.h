// A value kept as its MessagePack encoding. A message's payload travels through the service in
// this form: it is decoded into a dictionary only where one is needed, and each store writes
// its text straight from the bytes.
#pragma once

#include <cstdint>
#include <memory>
#include <msgpack.hpp>
#include <string>
#include <string_view>

#include "sxreporting/types.h"

class SXPackedValue {
 public:
  static SXPackedValue fromValue(const SXValue& value);
  // A copy of the encoding of one value the value model can hold, as a client sent it.
  static SXPackedValue fromBytes(std::string_view bytes) {
    return SXPackedValue(std::string(bytes));
  }

  std::string_view bytes() const { return bytes_; }
  size_t size() const { return bytes_.size(); }
  bool isDictionary() const;
  // Whether the value is a dictionary with the member `key`.
  bool hasMember(std::string_view key) const;
  // The value itself, decoded now.
  SXValue value() const;

 private:
  explicit SXPackedValue(std::string bytes) : bytes_(std::move(bytes)) {}
  std::string bytes_;
};

// Throws SXValueConversionError when `object` has no place in the value model: a dictionary
// key that is not a string, or nesting deeper than `maxDepth`.
void SXCheckValueModel(const msgpack::object& object, int maxDepth);

// Reads MessagePack written by msgpack-c, one item at a time, without building anything. A
// container's item gives its number of elements (a dictionary's: of key-value pairs), which
// follow it. Throws std::out_of_range when the bytes end early or are not MessagePack.
class SXPackedReader {
 public:
  // What a reader does when the bytes end early.
  enum class OnEnd {
    kThrow,
    // The item is nil and `endedEarly` says so: for bytes still arriving, where running out is
    // no error and an exception for it would cost more than the read.
    kStop,
  };
  enum class Kind { kNil, kBool, kUnsigned, kSigned, kFloat, kString, kBinary, kExt, kArray, kMap };
  struct Item {
    Kind kind = Kind::kNil;
    bool boolean = false;
    uint64_t u = 0;
    int64_t i = 0;
    double f = 0;
    std::string_view data;  // string, binary and ext bytes
    int8_t extType = 0;
    uint32_t count = 0;  // array elements or map pairs
  };

  explicit SXPackedReader(std::string_view bytes) : at_(bytes.data()), end_(at_ + bytes.size()) {}
  SXPackedReader(const char* at, const char* end, OnEnd onEnd = OnEnd::kThrow)
      : at_(at), end_(end), onEnd_(onEnd) {}

  Item next() {
    // Small integers and short strings, most items of a payload, are read here; the rest out
    // of line.
    if (at_ != end_) {
      const auto head = static_cast<uint8_t>(*at_);
      Item item;
      if (head <= 0x7f) {
        ++at_;
        item.kind = Kind::kUnsigned;
        item.u = head;
        return item;
      }
      const size_t shortString = head & 0x1fu;
      if ((head & 0xe0) == 0xa0 && static_cast<size_t>(end_ - at_) > shortString) {
        item.kind = Kind::kString;
        item.data = std::string_view(at_ + 1, shortString);
        at_ += 1 + shortString;
        return item;
      }
    }
    return nextOther();
  }
  // Steps over one whole value, containers with everything in them.
  void skip();
  const char* position() const { return at_; }
  const char* end() const { return end_; }
  bool endedEarly() const { return endedEarly_; }

 private:
  Item nextOther();
  const char* take(size_t n);
  template <typename T>
  T big(size_t n);

  const char* at_;
  const char* end_;
  OnEnd onEnd_ = OnEnd::kThrow;
  bool endedEarly_ = false;
};
