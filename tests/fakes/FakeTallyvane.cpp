#include "fakes/FakeTallyvane.h"


FakeTallyvane::FakeTallyvane(Delivery delivery) : delivery_(delivery) {
  if (delivery_ == Delivery::kOwnThread) {
    thread_ = std::make_unique<SXCompletionThread>("fake-tallyvane", nullptr);
  }
}

FakeTallyvane::~FakeTallyvane() { thread_.reset(); }

void FakeTallyvane::record(const std::string& name, const SXPayloadProvider& provider,
                           bool wasInFlight) {
  SXValue payload = provider ? provider() : SXValue();
  {
    SXMutexLock lock(mutex_);
    events_.push_back({name, std::move(payload), std::this_thread::get_id()});
    if (wasInFlight) --inFlight_;
  }
  recorded_.notify_all();
}

bool FakeTallyvane::sendEventLazy(const std::string& name, SXPayloadProvider provider) {
  SXMutexLock lock(mutex_);
  bool accepts = accepts_;
  if (!accepts) return false;
  switch (delivery_) {
    case Delivery::kInline:
      lock.unlock();
      record(name, provider, false);
      break;
    case Delivery::kOwnThread:
      ++inFlight_;
      lock.unlock();
      thread_->post([this, name, provider = std::move(provider)] { record(name, provider, true); });
      break;
    case Delivery::kOnDeliver:
      held_.emplace_back(name, std::move(provider));
      break;
  }
  return true;
}

void FakeTallyvane::setAccepts(bool accepts) {
  SXMutexLock lock(mutex_);
  accepts_ = accepts;
}

void FakeTallyvane::deliver() {
  std::vector<std::pair<std::string, SXPayloadProvider>> held;
  {
    SXMutexLock lock(mutex_);
    held.swap(held_);
  }
  for (const auto& [name, provider] : held) record(name, provider, false);
}

std::vector<FakeTallyvane::Event> FakeTallyvane::events() const {
  SXMutexLock lock(mutex_);
  return events_;
}

std::vector<std::string> FakeTallyvane::names() const {
  SXMutexLock lock(mutex_);
  std::vector<std::string> out;
  for (const auto& e : events_) out.push_back(e.name);
  return out;
}

size_t FakeTallyvane::pending() const {
  SXMutexLock lock(mutex_);
  return held_.size() + inFlight_;
}

bool FakeTallyvane::waitForEvents(size_t count, std::chrono::milliseconds timeout) const {
  SXMutexLock lock(mutex_);
  return lock.waitFor(recorded_, timeout,
                      [&]() SX_REQUIRES(mutex_) { return events_.size() >= count; });
}
