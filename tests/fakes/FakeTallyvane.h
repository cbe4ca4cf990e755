// Counts analytics events, making each one's payload at once on the caller's thread; takes
// power-log entries and keeps nothing of them.
#pragma once

#include <atomic>
#include <optional>
#include <string>

#include "platform/Joulebook.h"
#include "platform/Tallyvane.h"

class FakeTallyvane final : public SXTallyvane {
 public:
  bool sendEventLazy(const std::string&, SXPayloadProvider provider) override {
    if (provider) provider();
    ++events_;
    return true;
  }
  size_t eventCount() const { return events_; }

 private:
  std::atomic<size_t> events_{0};
};

class FakeJoulebook final : public SXJoulebook {
 public:
  void logRegisteredEvent(int, const std::string&, const SXValue&,
                          const std::optional<SXValue>&) override {}
};
