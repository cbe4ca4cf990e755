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

#include "AbuseAttacks.h"
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
  // Bytes in the daemon's log so far; empty when the benchmark does not hold the log.
  std::function<std::optional<uint64_t>()> logBytes;
};

// One phase of the abuse scenario: a quiet start, one attack, or all of them at once.
struct AbusePhase {
  std::string name;
  double seconds = 0;
  LatencyHistogram probes;  // the well-behaved client's reporterID:valid: round trips
  uint64_t unansweredProbes = 0;
  std::optional<long> maxRssKiB;  // sampled every 50 ms
  std::optional<long> endRssKiB;
  AttackCounters attacks;
  bool braked = false;  // ended early: the daemon's RSS passed the brake
};

struct AbuseFigures {
  double attackSeconds = 0;
  size_t partialConnections = 0;
  int partialFrameTimeoutMs = 0;
  long rssBrakeKiB = 0;
  std::vector<AbusePhase> phases;
  LatencyHistogram probes;  // every phase
  uint64_t unansweredProbes = 0;
  uint64_t proberReconnects = 0;
  std::optional<uint64_t> logBytes;
  bool alive = false;
  // A round trip on a fresh connection once the attacks are over: its latency, or why none.
  std::optional<uint64_t> finalRoundTripNanoseconds;
  std::string finalRoundTripError;
  std::vector<std::string> notes;
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
  std::optional<AbuseFigures> abuse;

  std::vector<std::string> errors;
};

TargetFigures RunScenario(const BenchScenario& scenario, const BenchOptions& options,
                          const BenchTarget& target);
TargetFigures RunIdle(const BenchScenario& scenario, const BenchOptions& options,
                      const BenchTarget& target);
// The abuse scenario. Only a daemon that cannot be reached at the start is an error: what the
// attacks do to it is the result.
TargetFigures RunAbuse(const BenchScenario& scenario, const BenchOptions& options,
                       const BenchTarget& target);
