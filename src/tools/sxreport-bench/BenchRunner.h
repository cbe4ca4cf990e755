// Runs one scenario against one server (the daemon or the echo baseline) and gathers its
// figures.
//
// Threads: one caller; the clients run on a thread of their own while it runs.
#pragma once

#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "BenchScenario.h"
#include "LatencyHistogram.h"
#include "StoreRows.h"

struct BenchTarget {
  std::string name;  // "daemon" or "baseline"
  std::string socketPath;
  std::string stateDir;  // the daemon's stores; empty: rows are not counted
  pid_t pid = -1;        // the process measured; -1: the one at the other end of the socket
  // The baseline serves inside the benchmark's own process: its CPU is this reading, and it
  // has no RSS of its own.
  std::function<std::optional<double>()> inProcessCpuSeconds;
  bool checkResults = true;  // whether replies must carry the values the daemon defines
};

struct TargetFigures {
  std::string target;
  uint64_t messages = 0;  // sent in the measure phase
  uint64_t requests = 0;  // timed replies
  double seconds = 0;     // the measure phase, first request to last reply
  LatencyHistogram latency;
  std::optional<double> cpuSeconds;  // from the measure phase to the end of the drain
  std::optional<long> peakRssKiB;
  std::optional<long> rssKiB;                         // at the end
  std::vector<std::pair<uint64_t, long>> rssSamples;  // (messages replied, KiB)
  bool rowsCounted = false;
  StoreCounts expectedRows;
  StoreCounts foundRows;
  double drainSeconds = 0;  // from the last reply until the last row landed
  uint64_t rejected = 0;
  // The idle scenario.
  std::optional<long> idleRssKiB;
  std::optional<long> rssWithSessionsKiB;
  std::optional<long> rssAfterCloseKiB;
  uint64_t sessions = 0;

  std::vector<std::string> errors;
};

TargetFigures RunScenario(const BenchScenario& scenario, const BenchOptions& options,
                          const BenchTarget& target);
TargetFigures RunIdle(const BenchScenario& scenario, const BenchOptions& options,
                      const BenchTarget& target);
