#include "platform/ByteBudget.h"

#include <utility>

SXByteBudget::Charge::Charge(std::shared_ptr<SXByteBudget> budget, uint64_t bytes)
    : budget_(std::move(budget)), bytes_(budget_ ? bytes : 0) {
  if (budget_) budget_->add(bytes_);
}

SXByteBudget::Charge::Charge(Charge&& other) noexcept
    : budget_(std::move(other.budget_)), bytes_(std::exchange(other.bytes_, 0)) {}

SXByteBudget::Charge& SXByteBudget::Charge::operator=(Charge&& other) noexcept {
  if (this != &other) {
    reset();
    budget_ = std::move(other.budget_);
    bytes_ = std::exchange(other.bytes_, 0);
  }
  return *this;
}

void SXByteBudget::Charge::reset() {
  if (budget_) budget_->release(bytes_);
  budget_.reset();
  bytes_ = 0;
}

SXByteBudget::SXByteBudget(uint64_t limit, std::shared_ptr<SXByteBudget> pool, uint64_t floor)
    : limit_(limit), pool_(std::move(pool)), floor_(floor) {}

void SXByteBudget::add(uint64_t bytes) {
  held_.fetch_add(bytes, std::memory_order_relaxed);
  if (pool_) pool_->add(bytes);
}

void SXByteBudget::release(uint64_t bytes) {
  held_.fetch_sub(bytes, std::memory_order_relaxed);
  if (pool_) pool_->release(bytes);
  wakeIfRoom();
}

bool SXByteBudget::poolOverLimit() const {
  return pool_ ? pool_->held() > pool_->limit() : held() > limit_;
}

bool SXByteBudget::overLimit() const {
  uint64_t held = this->held();
  if (held > limit_) return true;
  return pool_ && pool_->held() > pool_->limit() && held > floor_;
}

void SXByteBudget::wakeIfRoom() {
  if (!wakeArmed_.load() || overLimit()) return;
  if (wakeArmed_.exchange(false) && waker_) waker_();
}
