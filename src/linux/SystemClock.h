// Production wall-clock time. May be called from any thread.
#pragma once

#include <chrono>

#include "platform/Clock.h"

class SXSystemClock final : public SXClock {
 public:
  SXDate now() const override { return std::chrono::system_clock::now(); }
};
