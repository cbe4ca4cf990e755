// Records analytics events: each event's name and the payload its provider returns. The
// provider is called at once on the caller's thread, on a thread of the fake, or only when a
// test calls deliver(), as the test chooses.
#pragma once

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/CompletionThread.h"
#include "platform/Tallyvane.h"

class FakeTallyvane final : public SXTallyvane {
 public:
  enum class Delivery { kInline, kOwnThread, kOnDeliver };

  struct Event {
    std::string name;
    SXValue payload;
    std::thread::id providerThread;
  };

  explicit FakeTallyvane(Delivery delivery = Delivery::kInline);
  ~FakeTallyvane() override;

  bool sendEventLazy(const std::string& name, SXPayloadProvider provider) override;

  // What sendEventLazy() returns (true by default).
  void setAccepts(bool accepts);
  // kOnDeliver: calls the providers held so far, on the caller's thread.
  void deliver();

  std::vector<Event> events() const;
  std::vector<std::string> names() const;
  size_t pending() const;  // events whose provider has not run yet
  // Waits until `count` events are recorded; false when `timeout` passes first.
  bool waitForEvents(size_t count, std::chrono::milliseconds timeout) const;

 private:
  void record(const std::string& name, const SXPayloadProvider& provider, bool wasInFlight);

  const Delivery delivery_;
  mutable SXMutex mutex_;
  mutable std::condition_variable recorded_;
  bool accepts_ SX_GUARDED_BY(mutex_) = true;
  std::vector<Event> events_ SX_GUARDED_BY(mutex_);
  std::vector<std::pair<std::string, SXPayloadProvider>> held_ SX_GUARDED_BY(mutex_);
  size_t inFlight_ SX_GUARDED_BY(mutex_) = 0;   // posted to thread_, not run
  std::unique_ptr<SXCompletionThread> thread_;  // kOwnThread only; declared last, joined first
};
