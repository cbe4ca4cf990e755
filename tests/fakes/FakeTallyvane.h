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

// What a double was handed, in order; any thread.
template <typename Record>
class Recorded {
 public:
  void add(Record record) {
    SXMutexLock lock(mutex_);
    records_.push_back(std::move(record));
  }
  std::vector<Record> all() const {
    SXMutexLock lock(mutex_);
    return records_;
  }

 private:
  mutable SXMutex mutex_;
  std::vector<Record> records_ SX_GUARDED_BY(mutex_);
};

class FakeTallyvane final : public SXTallyvane {
 public:
  struct Event {
    std::string name;
    SXValue payload;
  };
  bool sendEventLazy(const std::string& name, SXPayloadProvider provider) override {
    events_.add({name, provider ? provider() : SXValue()});
    return true;
  }
  std::vector<Event> events() const { return events_.all(); }

 private:
  Recorded<Event> events_;
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
    entries_.add({clientID, event, entry});
  }
  std::vector<Entry> entries() const { return entries_.all(); }

 private:
  Recorded<Entry> entries_;
};
