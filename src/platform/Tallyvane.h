// Analytics events (Tallyvane): named events with a payload built on demand.
#pragma once

#include <functional>
#include <string>

#include "sxreporting/types.h"

using SXPayloadProvider = std::function<SXValue()>;

class SXTallyvane {
 public:
  virtual ~SXTallyvane() = default;
  // Offers the event `name`. Returns at once; the service calls `provider` later, on a thread
  // of its own, when it records the event. Returns whether the event was accepted.
  // May be called from any thread.
  virtual bool sendEventLazy(const std::string& name, SXPayloadProvider provider) = 0;
};
