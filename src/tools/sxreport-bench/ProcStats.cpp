#include "ProcStats.h"

#include <unistd.h>

#include <fstream>
#include <iterator>
#include <sstream>

namespace {

std::optional<double> cpuSecondsFromStat(const std::string& path) {
  std::ifstream in(path);
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  // The command name may hold spaces and parentheses; the fields after it never do.
  size_t close = text.rfind(')');
  if (close == std::string::npos) return std::nullopt;
  std::istringstream fields(text.substr(close + 1));
  std::string field;
  unsigned long long utime = 0, stime = 0;
  // After the name: state is field 3, utime field 14, stime field 15.
  try {
    for (int index = 3; index <= 15 && fields >> field; ++index) {
      if (index == 14) utime = std::stoull(field);
      if (index == 15) stime = std::stoull(field);
    }
  } catch (const std::exception&) {
    return std::nullopt;
  }
  if (!fields) return std::nullopt;
  return static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

}  // namespace

std::optional<double> ProcCpuSeconds(pid_t pid) {
  return cpuSecondsFromStat("/proc/" + std::to_string(pid) + "/stat");
}

std::optional<long> ProcStatusKiB(pid_t pid, const std::string& field) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  std::string prefix = field + ":";
  while (std::getline(in, line)) {
    if (line.compare(0, prefix.size(), prefix) != 0) continue;
    try {
      return std::stol(line.substr(prefix.size()));
    } catch (const std::exception&) {
      return std::nullopt;
    }
  }
  return std::nullopt;
}

bool ProcIsRunning(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  size_t close = text.rfind(')');
  if (close == std::string::npos || close + 2 >= text.size()) return false;
  char state = text[close + 2];
  return state != 'Z' && state != 'X' && state != 'x';
}
