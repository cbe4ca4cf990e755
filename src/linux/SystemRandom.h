// Production random integers: a Mersenne twister seeded from the kernel. May be called from
// any thread.
#pragma once

#include <cstdint>
#include <mutex>
#include <random>

#include "common/SXThreadSafety.h"
#include "platform/Random.h"

class SXSystemRandom final : public SXRandom {
 public:
  uint32_t uniform(uint32_t upperBound) override {
    if (upperBound == 0) return 0;
    SXMutexLock lock(mutex_);
    return std::uniform_int_distribution<uint32_t>(0, upperBound - 1)(engine_);
  }

 private:
  SXMutex mutex_;
  std::mt19937 engine_ SX_GUARDED_BY(mutex_){std::random_device{}()};
};
