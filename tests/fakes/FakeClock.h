// A clock that stands still until a test moves it.
#pragma once

#include <mutex>

#include "platform/Clock.h"

class FakeClock final : public SXClock {
 public:
  SXDate now() const override {
    std::lock_guard lock(mutex_);
    return now_;
  }
  void set(SXDate date) {
    std::lock_guard lock(mutex_);
    now_ = date;
  }
  void advance(double seconds) {
    std::lock_guard lock(mutex_);
    now_ += std::chrono::duration_cast<SXDate::duration>(std::chrono::duration<double>(seconds));
  }

 private:
  mutable std::mutex mutex_;
  SXDate now_ = SXDate(std::chrono::seconds(1'800'000'000));
};
