#include "fakes/FakeJoulebook.h"


void FakeJoulebook::logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                                       const std::optional<SXValue>& filter) {
  SXMutexLock lock(mutex_);
  entries_.push_back({clientID, event, entry, filter});
}

std::vector<FakeJoulebook::Entry> FakeJoulebook::entries() const {
  SXMutexLock lock(mutex_);
  return entries_;
}

void FakeJoulebook::clear() {
  SXMutexLock lock(mutex_);
  entries_.clear();
}
