// Process information and process exit. May be called from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

class SXProcessInfo {
 public:
  virtual ~SXProcessInfo() = default;
  virtual int32_t processIdentifier() const = 0;
  virtual std::string processName() const = 0;
  // The command name of another process. Returns nothing for pid < 1 or when it cannot be read.
  virtual std::optional<std::string> commandName(int32_t pid) const = 0;
  // Ends the process at once with `status`, running no destructors.
  virtual void exitProcess(int status) = 0;
};
