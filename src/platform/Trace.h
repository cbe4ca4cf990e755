// Kernel trace points: a 32-bit code with four zero arguments. May be called from any thread.
#pragma once

#include <cstdint>

class SXTracer {
 public:
  virtual ~SXTracer() = default;
  virtual void trace(uint32_t code) = 0;
};
