// A connection that a test drives by hand: it keeps what the delegate installs and lets the
// test send requests and end the connection.
#pragma once

#include <mutex>
#include <vector>

#include "common/MsgpackValue.h"
#include "common/SXThreadSafety.h"
#include "platform/Ipc.h"

class FakeIpcConnection final : public SXIpcConnection {
 public:
  explicit FakeIpcConnection(int32_t pid) : pid_(pid) {}
  int32_t processIdentifier() const override { return pid_; }
  std::string description() const override {
    return "<fake connection " + std::to_string(pid_) + ">";
  }
  void setExportedObject(std::shared_ptr<SXIpcExportedObject> object) override {
    exported_ = std::move(object);
  }
  void setInterruptionHandler(std::function<void()> h) override { interruption_ = std::move(h); }
  void setInvalidationHandler(std::function<void()> h) override { invalidation_ = std::move(h); }
  void resume() override { resumed_ = true; }

  struct Response {
    SXValue error;
    SXValue result;
  };
  // Sends a request; replies collect in `responses`. Its size is what its params pack into,
  // plus an envelope.
  void request(std::string_view method, SXValue params) {
    size_t wireBytes = SXPackedSize(params) + method.size() + 8;
    exported_->handleRequest(method, params, wireBytes, [this](const SXValue& e, const SXValue& r) {
      SXMutexLock lock(mutex_);
      responses_.push_back({e, r});
    });
  }
  std::vector<Response> responses() const {
    SXMutexLock lock(mutex_);
    return responses_;
  }
  // Ends the connection as the IPC layer would: interruption (when `interrupted`), then
  // invalidation, then the exported object is released.
  void end(bool interrupted) {
    if (interrupted && interruption_) std::exchange(interruption_, nullptr)();
    if (invalidation_) std::exchange(invalidation_, nullptr)();
    exported_.reset();
  }
  bool resumed() const { return resumed_; }

 private:
  const int32_t pid_;
  std::shared_ptr<SXIpcExportedObject> exported_;
  std::function<void()> interruption_;
  std::function<void()> invalidation_;
  bool resumed_ = false;
  mutable SXMutex mutex_;
  std::vector<Response> responses_;
};
