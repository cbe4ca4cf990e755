// Records analytics events (each event's name and the payload its provider returns, called at
// once on the caller's thread) and power-log entries, in the order they come.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Joulebook.h"
#include "platform/Tallyvane.h"

class FakeTallyvane final : public SXTallyvane {
 public:
  struct Event {
    std::string name;
    SXValue payload;
  };
  bool sendEventLazy(const std::string& name, SXPayloadProvider provider) override {
    SXValue payload = provider ? provider() : SXValue();
    SXMutexLock lock(mutex_);
    events_.push_back({name, std::move(payload)});
    return true;
  }
  std::vector<Event> events() const {
    SXMutexLock lock(mutex_);
    return events_;
  }

 private:
  mutable SXMutex mutex_;
  std::vector<Event> events_ SX_GUARDED_BY(mutex_);
};

class FakeJoulebook final : public SXJoulebook {
 public:
  struct Entry {
    int clientID = 0;
    std::string event;
    SXValue entry;
  };
  void logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                          const std::optional<SXValue>&) override {
    SXMutexLock lock(mutex_);
    entries_.push_back({clientID, event, entry});
  }
  std::vector<Entry> entries() const {
    SXMutexLock lock(mutex_);
    return entries_;
  }

 private:
  mutable SXMutex mutex_;
  std::vector<Entry> entries_ SX_GUARDED_BY(mutex_);
};
