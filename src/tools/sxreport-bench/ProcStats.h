// What /proc says about a process: CPU time used and resident memory. Each call reads the file
// afresh; on failure (the process is gone, /proc is not readable) it returns nothing.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

// User plus system CPU seconds of process `pid`, from /proc/<pid>/stat.
std::optional<double> ProcCpuSeconds(pid_t pid);

// A field of /proc/<pid>/status in KiB: "VmRSS" (resident now) or "VmHWM" (peak resident).
std::optional<long> ProcStatusKiB(pid_t pid, const std::string& field);

// Whether process `pid` exists and has not exited (a zombie has).
bool ProcIsRunning(pid_t pid);
