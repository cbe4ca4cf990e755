// Numbers the service keeps about itself for `status:`: messages taken in, messages each sink
// accepted, guardrail hits, and the live-session gauge. Counters only grow; the gauge follows
// the session registries.
//
// Threads: every method may be called from any thread; each number is one relaxed atomic, so a
// reading of several numbers is not one consistent instant.
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>

#include "platform/Joulebook.h"
#include "sxreporting/types.h"

enum class SXReportingSink { kTallyvane, kJoulebook, kFernReporting };
enum class SXReportingGuardrail {
  kSessionsPerClient,
  kSessionsTotal,
  kAggregateEntries,
  kAggregateBytes,
  kStandalonePending,
  kPayloadBytes,
  kConfigurationBytes,
  kReporterIDs,
  kErrorLines,
  kConnectionsPerClient,
  kCount,
};

class SXReportingCounters {
 public:
  void messageReceived() { received_.fetch_add(1, std::memory_order_relaxed); }
  void delivered(SXReportingSink sink) {
    delivered_[index(sink)].fetch_add(1, std::memory_order_relaxed);
  }
  void dropped(SXReportingGuardrail guardrail) {
    dropped_[index(guardrail)].fetch_add(1, std::memory_order_relaxed);
  }
  // The session registries report every session they take in and let go of.
  void sessionsAdded(uint64_t count) { sessionsLive_.fetch_add(count); }
  void sessionsRemoved(uint64_t count) { sessionsLive_.fetch_sub(count); }
  // The aggregates report the bytes they hold.
  void aggregateBytesAdded(uint64_t n) { aggregateBytes_.fetch_add(n); }
  void aggregateBytesRemoved(uint64_t n) { aggregateBytes_.fetch_sub(n); }
  uint64_t aggregateBytes() const { return aggregateBytes_.load(); }

  uint64_t messagesReceived() const { return received_.load(std::memory_order_relaxed); }
  uint64_t deliveredTo(SXReportingSink sink) const { return delivered_[index(sink)].load(); }
  uint64_t droppedBy(SXReportingGuardrail guardrail) const {
    return dropped_[index(guardrail)].load();
  }
  uint64_t sessionsLive() const { return sessionsLive_.load(); }

  // {"messages_received", "messages_delivered": {sink: N}, "guardrail_dropped": {name: N}}.
  // The caller adds what other parts of the daemon count.
  SXValue toValue() const;

  static const char* name(SXReportingSink sink);
  static const char* name(SXReportingGuardrail guardrail);

 private:
  static constexpr size_t index(SXReportingSink sink) { return static_cast<size_t>(sink); }
  static constexpr size_t index(SXReportingGuardrail g) { return static_cast<size_t>(g); }

  std::atomic<uint64_t> received_{0};
  std::array<std::atomic<uint64_t>, 3> delivered_{};
  std::array<std::atomic<uint64_t>, static_cast<size_t>(SXReportingGuardrail::kCount)> dropped_{};
  std::atomic<uint64_t> sessionsLive_{0};
  std::atomic<uint64_t> aggregateBytes_{0};
};

// Forwards to the power log and counts each entry as a delivered message: only the power-log
// bridge writes there, one entry per message that reports an engine on-time.
class SXReportingCountingJoulebook final : public SXJoulebook {
 public:
  SXReportingCountingJoulebook(std::shared_ptr<SXJoulebook> target,
                               std::shared_ptr<SXReportingCounters> counters)
      : target_(std::move(target)), counters_(std::move(counters)) {}
  void logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                          const std::optional<SXValue>& filter) override {
    target_->logRegisteredEvent(clientID, event, entry, filter);
    counters_->delivered(SXReportingSink::kJoulebook);
  }

 private:
  const std::shared_ptr<SXJoulebook> target_;
  const std::shared_ptr<SXReportingCounters> counters_;
};
