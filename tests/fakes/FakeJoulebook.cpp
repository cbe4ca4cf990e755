#include "fakes/FakeJoulebook.h"

void FakeJoulebook::logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                                       const std::optional<SXValue>& filter) {
  std::lock_guard lock(mutex_);
  entries_.push_back({clientID, event, entry, filter});
}

std::vector<FakeJoulebook::Entry> FakeJoulebook::entries() const {
  std::lock_guard lock(mutex_);
  return entries_;
}

void FakeJoulebook::clear() {
  std::lock_guard lock(mutex_);
  entries_.clear();
}
