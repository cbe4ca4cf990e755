// Uniform random integers. May be called from any thread.
#pragma once

#include <cstdint>
#include <mutex>
#include <random>

#include "common/SXThreadSafety.h"

class SXRandom {
 public:
  virtual ~SXRandom() = default;
  // A uniform random integer in [0, upperBound); 0 when upperBound is 0.
  virtual uint32_t uniform(uint32_t upperBound) = 0;
};

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
