// A log facility that writes nothing, for adapters given no log: they can then log
// unconditionally. May be called from any thread.
#pragma once

#include <memory>

#include "platform/Log.h"

class SXDiscardLog final : public SXLogFacility {
 public:
  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override {
    return std::make_shared<const SXLogScope>(scope);
  }
  bool isEnabled(const SXLogScope*, int) const override { return false; }
  void write(const SXLogScope*, SXLogLevel, std::string_view) override {}
};

// `log`, or a facility that discards everything when `log` is null.
inline std::shared_ptr<SXLogFacility> SXLogOrDiscard(std::shared_ptr<SXLogFacility> log) {
  if (log) return log;
  return std::make_shared<SXDiscardLog>();
}
