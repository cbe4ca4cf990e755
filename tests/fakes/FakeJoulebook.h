// Records power-log entries in the order they are logged.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Joulebook.h"

class FakeJoulebook final : public SXJoulebook {
 public:
  struct Entry {
    int clientID = 0;
    std::string event;
    SXValue entry;
    std::optional<SXValue> filter;
  };

  void logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                          const std::optional<SXValue>& filter) override;

  std::vector<Entry> entries() const;
  void clear();

 private:
  mutable SXMutex mutex_;
  std::vector<Entry> entries_ SX_GUARDED_BY(mutex_);
};
