// A clock that stands still until a test moves it.
#pragma once

#include <mutex>

#include "common/SXThreadSafety.h"
#include "platform/Clock.h"

class FakeClock final : public SXClock {
 public:
  SXDate now() const override {
    SXMutexLock lock(mutex_);
    return now_;
  }
  void set(SXDate date) {
    SXMutexLock lock(mutex_);
    now_ = date;
  }
  void advance(double seconds) {
    SXMutexLock lock(mutex_);
    now_ += std::chrono::duration_cast<SXDate::duration>(std::chrono::duration<double>(seconds));
  }

 private:
  mutable SXMutex mutex_;
  SXDate now_ = SXDate(std::chrono::seconds(1'800'000'000));
};
