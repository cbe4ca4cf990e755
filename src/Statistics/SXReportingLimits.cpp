#include "SXReportingLimits.h"

std::shared_ptr<SXReportingPendingBudget::Slot> SXReportingPendingBudget::tryAcquire(
    uint64_t bytes) {
  uint64_t current = pending_.load();
  do {
    if (current + bytes > capacity_) return nullptr;
  } while (!pending_.compare_exchange_weak(current, current + bytes));
  return std::make_shared<Slot>(shared_from_this(), bytes);
}

void SXReportingPendingBudget::release(uint64_t bytes) {
  uint64_t left = pending_.fetch_sub(bytes) - bytes;
  if (left <= capacity_ / 2) overflowing_.store(false);
}
