// Records trace codes in order.
#pragma once

#include <mutex>
#include <vector>

#include "platform/Trace.h"

class FakeTracer final : public SXTracer {
 public:
  void trace(uint32_t code) override {
    std::lock_guard lock(mutex_);
    codes_.push_back(code);
  }
  std::vector<uint32_t> codes() const {
    std::lock_guard lock(mutex_);
    return codes_;
  }
  void clear() {
    std::lock_guard lock(mutex_);
    codes_.clear();
  }

 private:
  mutable std::mutex mutex_;
  std::vector<uint32_t> codes_;
};
