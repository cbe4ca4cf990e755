// Production trace points: each fires the USDT probe sxreporting:trace(code). May be called
// from any thread.
#pragma once

#include <cstdint>

#include "platform/Trace.h"

class SXUsdtTracer final : public SXTracer {
 public:
  void trace(uint32_t code) override;
};
