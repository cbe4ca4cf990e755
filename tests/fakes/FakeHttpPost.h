// An HTTP client that answers from a script: each post() takes the next scripted answer (a
// status, or a failure without response); when the script is empty it answers 200. Records
// every request. May be called from any thread.
#pragma once

#include <deque>
#include <vector>

#include "common/SXThreadSafety.h"
#include "export/HttpPost.h"

class FakeHttpPost final : public SXHttpPost {
 public:
  SXHttpResult post(const SXHttpRequest& request) override {
    SXMutexLock lock(mutex_);
    requests_.push_back(request);
    if (cancelled_) return {std::nullopt, {}, "", "cancelled"};
    if (script_.empty()) return {200, {}, "", ""};
    SXHttpResult result = script_.front();
    script_.pop_front();
    return result;
  }
  void cancel() override {
    SXMutexLock lock(mutex_);
    cancelled_ = true;
  }

  // Scripts the next answer: a status (with `body` and `headers`)...
  void answer(int status, std::string body = "", std::map<std::string, std::string> headers = {}) {
    push({status, std::move(headers), std::move(body), ""});
  }
  // ... or no response, with `error`, or none within the request's timeout.
  void fail(std::string error) { push({std::nullopt, {}, "", std::move(error)}); }
  void timeOut() { push({std::nullopt, {}, "", "timed out", true}); }

  std::vector<SXHttpRequest> requests() const {
    SXMutexLock lock(mutex_);
    return requests_;
  }
  bool cancelled() const {
    SXMutexLock lock(mutex_);
    return cancelled_;
  }

 private:
  void push(SXHttpResult result) {
    SXMutexLock lock(mutex_);
    script_.push_back(std::move(result));
  }

  mutable SXMutex mutex_;
  std::deque<SXHttpResult> script_ SX_GUARDED_BY(mutex_);
  std::vector<SXHttpRequest> requests_ SX_GUARDED_BY(mutex_);
  bool cancelled_ SX_GUARDED_BY(mutex_) = false;
};
