// Analytics events (Tallyvane): named events with a payload built on demand.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "sxreporting/types.h"

using SXPayloadProvider = std::function<SXValue()>;
// A text shared with whoever else needs the same one.
using SXPayloadTextProvider = std::function<std::shared_ptr<const std::string>()>;

class SXTallyvane {
 public:
  virtual ~SXTallyvane() = default;
  // Offers the event `name`. Returns at once; the service calls `provider` later, on a thread
  // of its own, when it records the event. Returns whether the event was accepted.
  // May be called from any thread.
  virtual bool sendEventLazy(const std::string& name, SXPayloadProvider provider) = 0;

  // The same, for a service that records payloads as JSON: `json` returns exactly the
  // compact JSON text (SXValueText) of what `provider` returns, built without the dictionary.
  // A service calls one of the two; by default, `provider`.
  virtual bool sendEventLazy(const std::string& name, SXPayloadProvider provider,
                             SXPayloadTextProvider json) {
    (void)json;
    return sendEventLazy(name, std::move(provider));
  }
};
