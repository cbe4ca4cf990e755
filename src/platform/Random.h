// Uniform random integers. May be called from any thread.
#pragma once

#include <cstdint>

class SXRandom {
 public:
  virtual ~SXRandom() = default;
  // A uniform random integer in [0, upperBound); 0 when upperBound is 0.
  virtual uint32_t uniform(uint32_t upperBound) = 0;
};
