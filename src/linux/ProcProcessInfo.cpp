#include "linux/ProcProcessInfo.h"

#include <unistd.h>

#include <cstdio>
#include <fstream>

int32_t SXProcProcessInfo::processIdentifier() const { return static_cast<int32_t>(::getpid()); }

std::string SXProcProcessInfo::processName() const {
  return commandName(processIdentifier()).value_or("sxreportingd");
}

std::optional<std::string> SXProcProcessInfo::commandName(int32_t pid) const {
  if (pid < 1) return std::nullopt;
  std::ifstream in("/proc/" + std::to_string(pid) + "/comm");
  std::string name;
  if (!in || !std::getline(in, name)) return std::nullopt;
  return name;
}

void SXProcProcessInfo::exitProcess(int status) {
  std::fflush(stderr);
  ::_exit(status);
}
