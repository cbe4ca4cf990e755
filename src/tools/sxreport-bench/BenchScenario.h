// What each client of a scenario sends, phase by phase, and which rows the daemon's stores
// should hold afterwards.
//
//   setup     sessions created, configured and (where the scenario needs it) started
//   measure   the requests whose replies are timed and counted
//   teardown  sessions stopped and destroyed; every reply awaited, held ones too
//
// Reporter IDs are derived from this process's id, so that runs against a shared daemon do not
// collide. Threads: a source is called only on the thread that runs the client.
#pragma once

#include <string>
#include <vector>

#include "BenchOptions.h"
#include "PipelinedRpcClient.h"
#include "StoreRows.h"

class BenchScenario {
 public:
  // The analytics event and spool category/type of every benchmark message.
  static constexpr uint32_t kCategory = 0x80000003;  // "Kitbench_Playback"
  static constexpr uint16_t kType = 1;               // "Start"
  static const char* eventName() { return "com.vendra.sonex.Kitbench_Playback.Start"; }

  // abuse: how long the spawned daemon is asked to wait for the rest of a request.
  static constexpr int kAbusePartialFrameTimeoutMs = 2000;

  BenchScenario(ScenarioKind kind, const BenchOptions& options);

  ScenarioKind kind() const { return kind_; }
  RequestSource setup(size_t client) const;
  RequestSource measure(size_t client) const;
  RequestSource teardown(size_t client) const;

  // Requests in flight per client: the option, except 1 for the ping-pong of rpc.
  size_t window() const;
  // Messages each client sends in the measure phase (rpc: requests).
  uint64_t messagesPerClient() const;
  // Whether the scenario's messages land in the stores, and how many rows they should leave.
  bool landsRows() const;
  StoreCounts expectedRows() const;
  // Flags a spawned daemon gets for this scenario (the user's --daemon-flag ones come after).
  std::vector<DaemonFlag> daemonFlags() const;

  // The reporter ID of a client's index-th session, within this process's own range.
  int64_t sessionID(size_t client, uint64_t index) const;

 private:
  uint64_t lifecycleLoops() const;

  const ScenarioKind kind_;
  const BenchOptions& options_;
  const int64_t idBase_;
  const std::string runID_;
};
