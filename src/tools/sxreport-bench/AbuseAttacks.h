// The abuse scenario's clients: five hostile ones that repeat attacks which once made the daemon
// use gigabytes, and a well-behaved one that keeps timing reporterID:valid: meanwhile.
//
// They talk to the socket directly (non-blocking, every wait bounded by a deadline), because a
// hostile client must be able to stop reading, stop mid-frame, or find its connection ended,
// and a daemon that stops accepting must not hang the benchmark.
//
// Threads: each attack runs on the calling thread; the prober runs on a thread of its own.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "BenchScenario.h"
#include "LatencyHistogram.h"

enum class AttackKind {
  kLargeConfigurations,  // ~900 KB configuration dictionaries, again and again
  kPartialFrames,        // connections that stop just short of the end of a ~1 MiB request
  kLongIdLists,          // [id] x 2000 with ~500 KB payloads, and 65,536 unknown IDs
  kUnreadReplies,        // pipelined requests with large replies, never read
  kLargePayloads,        // ~900 KB messages to a started session
};

constexpr AttackKind kAllAttacks[] = {AttackKind::kLargeConfigurations, AttackKind::kPartialFrames,
                                      AttackKind::kLongIdLists, AttackKind::kUnreadReplies,
                                      AttackKind::kLargePayloads};

const char* AttackName(AttackKind kind);

// What an attack did, and what the daemon did to it. Refusals are expected of a daemon that
// defends itself; they are counted, never a failure of the benchmark.
struct AttackCounters {
  uint64_t connections = 0;      // opened
  uint64_t connectFailures = 0;  // refused, or the backlog stayed full
  uint64_t requests = 0;         // whole requests written
  uint64_t bytesWritten = 0;
  uint64_t replies = 0;       // to the attack's own requests (setup replies not counted)
  uint64_t errorReplies = 0;  // an error string
  uint64_t refused = 0;       // no error, but false, or an error dictionary for a send
  uint64_t closedByDaemon = 0;
  uint64_t unanswered = 0;  // requests still without a reply when the attack ended
  // Partial frames: prefixes written whole (the attack's time may run out first), and seconds
  // from a connection's last byte until the daemon ended it.
  uint64_t partialConnections = 0;
  uint64_t partialPrefixes = 0;
  uint64_t partialPrefixBytes = 0;  // of each
  uint64_t partialFrameBytes = 0;   // the whole request they are the start of
  std::vector<double> closeDelays;
  std::string firstError;  // the first error reply or refusal, shortened

  void merge(const AttackCounters& other);
};

struct AttackPlan {
  std::string socketPath;
  const BenchScenario* scenario = nullptr;  // reporter IDs
  size_t partialConnections = 1000;
  // How long the daemon is asked to wait for the rest of a frame: the partial-frame attack
  // holds its connections this long past its last byte, plus a margin, to see them closed.
  std::chrono::milliseconds partialFrameTimeout{2000};
};

// Runs one attack until `deadline` (the partial frames: until their timeout has had time to
// pass) or until `stop` is raised.
AttackCounters RunAttack(AttackKind kind, const AttackPlan& plan,
                         std::chrono::steady_clock::time_point deadline,
                         const std::atomic<bool>& stop);

// The process at the other end of the socket, or -1.
pid_t AbusePeerPid(const std::string& socketPath);

// The well-behaved client: one connection, one session, and a reporterID:valid: round trip
// every 10 ms (the next one as soon as a late reply comes). Latencies go to the phase current
// when the request went out.
class Prober {
 public:
  static constexpr std::chrono::milliseconds kInterval{10};
  static constexpr std::chrono::milliseconds kReplyTimeout{5000};

  Prober(std::string socketPath, const BenchScenario& scenario, size_t phases);
  ~Prober();  // stops
  Prober(const Prober&) = delete;
  Prober& operator=(const Prober&) = delete;

  void start();
  void setPhase(size_t phase) { phase_.store(phase); }
  // Ends the probing (after the probe in flight, at most kReplyTimeout) and joins the thread.
  void stop();

  // Final once stopped. A probe without a reply within kReplyTimeout counts as unanswered and
  // records the time it waited.
  const LatencyHistogram& latency(size_t phase) const { return phases_[phase].latency; }
  uint64_t unanswered(size_t phase) const { return phases_[phase].unanswered; }
  uint64_t reconnects() const { return reconnects_; }

  // One round trip on a fresh connection: its latency, or nothing (and why).
  static std::optional<uint64_t> RoundTrip(const std::string& socketPath, int64_t reporterID,
                                           std::chrono::milliseconds timeout, std::string& error);

 private:
  struct Phase {
    LatencyHistogram latency;
    uint64_t unanswered = 0;
  };

  void run();

  const std::string socketPath_;
  const BenchScenario& scenario_;
  std::vector<Phase> phases_;
  std::atomic<size_t> phase_{0};
  std::atomic<bool> stop_{false};
  uint64_t reconnects_ = 0;
  std::thread thread_;
};
