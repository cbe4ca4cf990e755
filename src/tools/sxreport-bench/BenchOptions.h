// The command line of sxreport-bench.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

enum class ScenarioKind { kAddressed, kBroadcast, kStandalone, kLifecycle, kRpc, kIdle, kAbuse };

// A flag given to a spawned daemon, as "--name value". An optional one is one the daemon may
// not know yet: when the daemon refuses it, it is dropped and the daemon started again.
struct DaemonFlag {
  std::string name;
  std::string value;
  bool optional = false;
};

struct BenchOptions {
  std::string socketPath;  // a running daemon; empty with --spawn
  std::string stateDir;    // its stores, for the row counts
  bool spawn = false;
  std::string daemonPath;  // for --spawn; default: sxreportingd beside this executable
  bool keep = false;       // keep the spawned daemons' directories
  bool baseline = false;
  bool json = false;
  std::vector<ScenarioKind> scenarios = {ScenarioKind::kAddressed};
  size_t clients = 4;
  uint64_t messages = 20'000;  // per client
  size_t sessions = 1;         // per client, the active one included
  size_t window = 32;
  uint64_t stopEvery = 0;  // 0: never
  size_t rssSamples = 10;
  double drainTimeoutSeconds = 60;
  double replyTimeoutSeconds = 30;
  std::vector<DaemonFlag> daemonFlags;  // --daemon-flag, for every spawned daemon
  // The abuse scenario.
  double attackSeconds = 4;          // each attack, and all of them at once
  size_t partialConnections = 1000;  // bounded by the descriptors this process may open
};

const char* ScenarioName(ScenarioKind kind);

// Returns nothing to go on, else the exit status (0 after --help or --version, 2 after a usage
// error), having printed what it says.
std::optional<int> ParseBenchOptions(int argc, char** argv, BenchOptions& options);
