// Wall-clock time and sleeping. May be called from any thread.
#pragma once

#include <chrono>

using SXDate = std::chrono::system_clock::time_point;

class SXClock {
 public:
  virtual ~SXClock() = default;
  virtual SXDate now() const = 0;
};

// Seconds between two dates, as a floating value (b - a).
inline double SXSecondsBetween(SXDate a, SXDate b) {
  return std::chrono::duration<double>(b - a).count();
}
