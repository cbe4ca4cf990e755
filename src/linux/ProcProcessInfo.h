// Process information from the kernel. May be called from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/ProcessInfo.h"

// Production: getpid(), /proc/<pid>/comm, _exit.
class SXProcProcessInfo final : public SXProcessInfo {
 public:
  int32_t processIdentifier() const override;
  std::string processName() const override;
  std::optional<std::string> commandName(int32_t pid) const override;
  void exitProcess(int status) override;
};
