// printf-style formatting that also takes "%@", the text of a value (SXValueText).
#pragma once

#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>

#include "sxreporting/types.h"

// One argument of SXFormat. Holds integers, floating values, strings and values; an absent
// value (nullptr, an empty optional, a null SXValue) prints as "(null)" under "%@".
class SXFormatArg {
 public:
  template <typename T>
  requires(std::is_integral_v<T>&& std::is_signed_v<T> && !std::is_same_v<T, bool>) SXFormatArg(T v)
      : v_(static_cast<int64_t>(v)) {}
  template <typename T>
  requires(std::is_integral_v<T>&& std::is_unsigned_v<T> && !std::is_same_v<T, bool>)
      SXFormatArg(T v)
      : v_(static_cast<uint64_t>(v)) {}
  SXFormatArg(bool v) : v_(static_cast<int64_t>(v)) {}
  SXFormatArg(double v) : v_(v) {}
  SXFormatArg(float v) : v_(static_cast<double>(v)) {}
  SXFormatArg(const char* v) : v_(v ? Text(std::string_view(v)) : Text()) {}
  SXFormatArg(std::string_view v) : v_(Text(v)) {}
  SXFormatArg(const std::string& v) : v_(Text(std::string_view(v))) {}
  SXFormatArg(std::nullptr_t) : v_(std::monostate()) {}
  SXFormatArg(const SXValue& v) : v_(&v) {}
  SXFormatArg(const std::optional<std::string>& v)
      : v_(v ? SXFormatArg(*v).v_ : Variant(std::monostate())) {}
  SXFormatArg(const std::optional<SXValue>& v) : v_(v ? Variant(&*v) : Variant(std::monostate())) {}

  std::string text() const;  // as "%@" prints it
  void appendText(std::string& out) const;
  bool isNull() const { return std::holds_alternative<std::monostate>(v_); }
  int64_t asSigned() const;
  uint64_t asUnsigned() const;
  double asDouble() const;

 private:
  struct Text {
    Text() = default;
    explicit Text(std::string_view s) : present(true), view(s) {}
    bool present = false;
    std::string_view view;
  };
  using Variant = std::variant<std::monostate, int64_t, uint64_t, double, Text, const SXValue*>;
  Variant v_;
};

// Formats `format` with `args`. Conversions: %@ %s %d %i %u %x %f %e %g %c %% with the usual
// flags, width, precision and length modifiers (which only say how the caller's value was typed;
// the argument keeps its own width). Missing arguments print as "(null)".
std::string SXFormatV(std::string_view format, std::initializer_list<SXFormatArg> args);
// The same, appended to `out`.
void SXFormatAppendV(std::string& out, std::string_view format,
                     std::initializer_list<SXFormatArg> args);

template <typename... Args>
std::string SXFormat(std::string_view format, const Args&... args) {
  return SXFormatV(format, {SXFormatArg(args)...});
}
