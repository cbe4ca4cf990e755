// The outcome of a fallible platform call: SXStatus (ok, or the text of what went wrong) and
// SXResult<T> (a T, or that text), in the manner of std::expected<T, std::string>, which the
// project's C++20 does not have.
//
// The text is what callers log or hand to a client as it is, so it is the whole message
// ("<context>: <why>"); callers add their own context in front when they need to.
//
// Neither converts to bool: the optional<string> these replace read true on failure,
// std::expected reads true on success; ok() leaves no doubt.
// Both are [[nodiscard]], so that a failure cannot be dropped without saying so ((void)).
#pragma once

#include <cassert>
#include <cstring>
#include <optional>
#include <string>
#include <utility>
#include <variant>

class [[nodiscard]] SXStatus {
 public:
  SXStatus() = default;  // ok
  bool ok() const { return !error_; }
  // What went wrong; empty when ok().
  const std::string& error() const {
    static const std::string kNone;
    return error_ ? *error_ : kNone;
  }

 private:
  friend SXStatus SXFailure(std::string text);
  std::optional<std::string> error_;
};

// A failure saying `text`.
inline SXStatus SXFailure(std::string text) {
  SXStatus status;
  status.error_ = std::move(text);
  return status;
}

// "<context>: <strerror(errnum)>", the one place errno becomes text; the text alone for log
// lines.
inline std::string SXErrnoText(int errnum) { return std::strerror(errnum); }
inline std::string SXErrnoText(const std::string& context, int errnum) {
  return context + ": " + SXErrnoText(errnum);
}
inline SXStatus SXErrnoStatus(const std::string& context, int errnum) {
  return SXFailure(SXErrnoText(context, errnum));
}

template <typename T>
class [[nodiscard]] SXResult {
 public:
  // Both convert, as with std::expected, so that a function returns either as it is.
  SXResult(T value) : value_(std::in_place_index<0>, std::move(value)) {}  // NOLINT
  // A failure; `failure` must not be ok.
  SXResult(SXStatus failure) : value_(std::in_place_index<1>, std::move(failure)) {  // NOLINT
    assert(!std::get<1>(value_).ok());
  }

  bool ok() const { return value_.index() == 0; }
  // The value; only when ok().
  T& operator*() { return std::get<0>(value_); }
  const T& operator*() const { return std::get<0>(value_); }
  T* operator->() { return &std::get<0>(value_); }
  const T* operator->() const { return &std::get<0>(value_); }
  // What went wrong; empty when ok().
  const std::string& error() const { return status().error(); }
  // The failure, to pass on; ok when there is a value.
  const SXStatus& status() const {
    static const SXStatus kOk;
    return ok() ? kOk : std::get<1>(value_);
  }

 private:
  std::variant<T, SXStatus> value_;
};
