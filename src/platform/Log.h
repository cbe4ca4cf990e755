// Scoped logging and the system log.
//
// A log facility writes finished lines at a level, through a registered scope or through the
// default log (scope nullptr). Scopes are registered once with a four-character code packed
// big-endian, a short name, a subsystem, a category and an option value; the facility decides
// at which levels each scope is enabled. Level 5 is the verbose level: debug lines of a scope
// are written only when the scope is enabled at level 5.
//
// All methods may be called from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "common/SXFormat.h"

enum class SXLogLevel { kDefault, kInfo, kError, kDebug };

inline constexpr int kSXLogVerboseLevel = 5;

struct SXLogScope {
  bool enabled = true;
  uint64_t code = 0;
  std::string shortName;
  std::string subsystem;
  std::string category;
  int options = 0;
};

// The four characters of `name`, first character in the most significant byte.
constexpr uint64_t SXLogScopeCode(std::string_view name) {
  uint64_t code = 0;
  for (size_t i = 0; i < 4 && i < name.size(); ++i) code = (code << 8) | uint8_t(name[i]);
  return code;
}

class SXLogFacility {
 public:
  virtual ~SXLogFacility() = default;

  // Registers a scope. On failure returns nullptr; callers then log through the default log.
  virtual std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) = 0;

  // Whether `scope` (nullptr: the default log) is enabled at `level`.
  virtual bool isEnabled(const SXLogScope* scope, int level) const = 0;

  // Writes one whole line (without a trailing newline).
  virtual void write(const SXLogScope* scope, SXLogLevel level, std::string_view line) = 0;

  // Returns once every line written before the call is out: for a process about to end
  // without unwinding. A facility that writes at once has nothing to do.
  virtual void flush() {}
};

// Formats "<file>:<line>:<function>: " followed by the message and writes it. Debug lines are
// formatted and written only when the scope is enabled at the verbose level.
void SXLogWriteV(SXLogFacility& facility, const SXLogScope* scope, SXLogLevel level,
                 const char* file, int line, const char* function, std::string_view format,
                 std::initializer_list<SXFormatArg> args);

template <typename... Args>
void SXLogWrite(SXLogFacility& facility, const SXLogScope* scope, SXLogLevel level,
                const char* file, int line, const char* function, std::string_view format,
                const Args&... args) {
  if (level == SXLogLevel::kDebug && !facility.isEnabled(scope, kSXLogVerboseLevel)) return;
  SXLogWriteV(facility, scope, level, file, line, function, format, {SXFormatArg(args)...});
}

// SXLOG(facility, scope, level, format, args...): the function field is the C++ function.
#define SXLOG(facility, scope, level, ...) \
  SXLogWrite((facility), (scope), (level), __FILE__, __LINE__, __func__, __VA_ARGS__)
// SXLOG_IN: the same with the function field given, where the system's own name is fixed.
#define SXLOG_IN(function, facility, scope, level, ...) \
  SXLogWrite((facility), (scope), (level), __FILE__, __LINE__, (function), __VA_ARGS__)
