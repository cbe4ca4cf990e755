// Records trace codes in order.
#pragma once

#include <mutex>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Trace.h"

class FakeTracer final : public SXTracer {
 public:
  void trace(uint32_t code) override {
    SXMutexLock lock(mutex_);
    codes_.push_back(code);
  }
  std::vector<uint32_t> codes() const {
    SXMutexLock lock(mutex_);
    return codes_;
  }
  void clear() {
    SXMutexLock lock(mutex_);
    codes_.clear();
  }

 private:
  mutable SXMutex mutex_;
  std::vector<uint32_t> codes_;
};
