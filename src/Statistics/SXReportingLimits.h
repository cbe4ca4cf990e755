// The guardrails that bound what one client can make the service hold: sessions, aggregate
// entries and standalone sends waiting for their delay. None of them changes a reply; each
// one that trips is logged and counted in `status:` (SXReportingCounters).
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>

struct SXReportingLimits {
  // Live sessions in one client's registry. A create beyond it makes nothing (still true).
  uint64_t maxSessionsPerClient = 4096;
  // Live sessions in all registries together.
  uint64_t maxSessions = 65536;
  // Entries in one session's aggregate; further messages are sent but not aggregated, and the
  // summary event counts them.
  uint64_t maxAggregateEntries = 100000;
  // Standalone sends of one client waiting for their delay (alarms wait up to 59 s). Beyond
  // it a send goes out at once, without its delay.
  uint64_t maxPendingStandalone = 1024;
  // Requests of one connection read but not yet handled; beyond it the daemon stops reading
  // that connection until the server queue catches up (back-pressure, nothing is dropped).
  uint64_t maxQueuedRequests = 1024;
  // Reply bytes of one connection waiting to be written; beyond it the daemon stops reading
  // that connection, so a client that never reads its replies cannot grow the daemon.
  uint64_t maxPendingReplyBytes = 4 << 20;
};

// One client's count of standalone sends waiting for their delay.
//
// Threads: any thread may acquire; a slot is released on whatever thread drops its last copy.
class SXReportingPendingBudget : public std::enable_shared_from_this<SXReportingPendingBudget> {
 public:
  // Held by a waiting send; gives its place back when destroyed, whether or not it ran.
  class Slot {
   public:
    explicit Slot(std::shared_ptr<SXReportingPendingBudget> budget) : budget_(std::move(budget)) {}
    ~Slot() { budget_->release(); }
    Slot(const Slot&) = delete;
    Slot& operator=(const Slot&) = delete;

   private:
    const std::shared_ptr<SXReportingPendingBudget> budget_;
  };

  SXReportingPendingBudget(uint64_t capacity, int32_t owner) : capacity_(capacity), owner_(owner) {}

  // A slot, or nullptr when `capacity` sends are already waiting.
  std::shared_ptr<Slot> tryAcquire();
  // True once per run of refusals: the first refusal after the count was at most half full.
  // Lets callers log an overflow once instead of once per message.
  bool firstRefusal() { return !overflowing_.exchange(true); }

  uint64_t pending() const { return pending_.load(); }
  uint64_t capacity() const { return capacity_; }
  int32_t owner() const { return owner_; }

 private:
  void release();

  const uint64_t capacity_;
  const int32_t owner_;  // the client's process ID, for log lines
  std::atomic<uint64_t> pending_{0};
  std::atomic<bool> overflowing_{false};
};
