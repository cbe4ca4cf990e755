// The guardrails that bound what one client can make the service hold: sessions, request
// sizes, aggregates, standalone sends waiting for their delay and the bytes in flight. A
// request over a size limit gets an error reply; no other guardrail changes a reply. Each one
// that trips is logged (at most `maxErrorLines` lines a minute per client) and counted in
// `status:` (SXReportingCounters).
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>

struct SXReportingLimits {
  // Live sessions in one client's registry. A create beyond it makes nothing (still true).
  uint64_t maxSessionsPerClient = 4096;
  // Live sessions in all registries together.
  uint64_t maxSessions = 65536;
  // Entries in one session's aggregate; further messages are sent but not aggregated (the
  // summary then lacks them, and an error line says so).
  uint64_t maxAggregateEntries = 100000;
  // Bytes of one session's aggregate, and of all aggregates together (each entry's text and
  // about 256 bytes beside it); beyond either, messages are sent but not aggregated, as above.
  uint64_t maxAggregateBytes = 1 << 20;
  uint64_t maxAggregateBytesTotal = 8 << 20;
  // Payload bytes of one client's standalone sends waiting for their delay (alarms wait up to
  // 59 s). A delayed send beyond it is refused.
  uint64_t maxPendingStandaloneBytes = 1 << 20;
  // Request sizes (MessagePack bytes) and reporter-ID list length; beyond them the request
  // gets an error reply and changes nothing.
  uint64_t maxPayloadBytes = 64 << 10;
  uint64_t maxConfigurationBytes = 64 << 10;
  uint64_t maxReporterIDs = 1024;
  // Requests of one connection read but not yet handled; beyond it the daemon stops reading
  // that connection until the server queue catches up (back-pressure, nothing is dropped).
  uint64_t maxQueuedRequests = 1024;
  // Reply bytes of one connection waiting to be written; beyond it the daemon stops reading
  // that connection, so a client that never reads its replies cannot grow the daemon.
  uint64_t maxPendingReplyBytes = 4 << 20;
  // Bytes one connection may make the service hold (its requests until handled, its payloads
  // until every store and send has them), and all connections together; beyond them the
  // connections that hold the most stop being read.
  uint64_t maxConnectionBytes = 4 << 20;
  uint64_t maxInflightBytes = 16 << 20;
  // How long a request that has begun to arrive may take to complete.
  uint64_t partialFrameTimeoutMs = 30'000;
  // Open connections of one process; a further one is closed at once (logged and counted).
  uint64_t maxConnectionsPerClient = 128;
  // Error lines one client may cause a minute; the rest are counted in one summary line.
  uint64_t maxErrorLines = 20;
};

// The payload bytes of one client's standalone sends waiting for their delay.
//
// Threads: any thread may acquire; a slot is released on whatever thread drops its last copy.
class SXReportingPendingBudget : public std::enable_shared_from_this<SXReportingPendingBudget> {
 public:
  // Held by a waiting send; gives its place back when destroyed, whether or not it ran.
  class Slot {
   public:
    Slot(std::shared_ptr<SXReportingPendingBudget> budget, uint64_t bytes)
        : budget_(std::move(budget)), bytes_(bytes) {}
    ~Slot() { budget_->release(bytes_); }
    Slot(const Slot&) = delete;
    Slot& operator=(const Slot&) = delete;

   private:
    const std::shared_ptr<SXReportingPendingBudget> budget_;
    const uint64_t bytes_;
  };

  SXReportingPendingBudget(uint64_t capacity, int32_t owner) : capacity_(capacity), owner_(owner) {}

  // A slot of `bytes`, or nullptr when it would take the waiting bytes past `capacity`.
  std::shared_ptr<Slot> tryAcquire(uint64_t bytes);
  // True once per run of refusals: the first refusal after the count was at most half full.
  // Lets callers log an overflow once instead of once per message.
  bool firstRefusal() { return !overflowing_.exchange(true); }

  uint64_t pending() const { return pending_.load(); }
  uint64_t capacity() const { return capacity_; }
  int32_t owner() const { return owner_; }

 private:
  void release(uint64_t bytes);

  const uint64_t capacity_;
  const int32_t owner_;  // the client's process ID, for log lines
  std::atomic<uint64_t> pending_{0};
  std::atomic<bool> overflowing_{false};
};
