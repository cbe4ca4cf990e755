#include "SXReportingLimits.h"

std::shared_ptr<SXReportingPendingBudget::Slot> SXReportingPendingBudget::tryAcquire() {
  uint64_t current = pending_.load();
  do {
    if (current >= capacity_) return nullptr;
  } while (!pending_.compare_exchange_weak(current, current + 1));
  return std::make_shared<Slot>(shared_from_this());
}

void SXReportingPendingBudget::release() {
  uint64_t left = pending_.fetch_sub(1) - 1;
  if (left <= capacity_ / 2) overflowing_.store(false);
}
