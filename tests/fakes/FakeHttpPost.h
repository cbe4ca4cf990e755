// An HTTP client that answers from a script: each post() takes the next scripted answer (a
// status, or a failure without response); when the script is empty it answers 200. Records
// every request. May be called from any thread.
#pragma once

#include <deque>
#include <mutex>
#include <vector>

#include "common/SXThreadSafety.h"
#include "export/HttpPost.h"
#include "sxreporting/types.h"

class FakeHttpPost final : public SXHttpPost {
 public:
  SXHttpResult post(const SXHttpRequest& request) override;
  void cancel() override;

  // Answers the next post with `status` (and `body`, `headers`).
  void answer(int status, std::string body = "", std::map<std::string, std::string> headers = {});
  // The next post gets no response, with `error`.
  void fail(std::string error = "connection refused");
  // The next post gets no response within its timeout.
  void timeOut();

  std::vector<SXHttpRequest> requests() const;
  bool cancelled() const;

 private:
  mutable SXMutex mutex_;
  std::deque<SXHttpResult> script_ SX_GUARDED_BY(mutex_);
  std::vector<SXHttpRequest> requests_ SX_GUARDED_BY(mutex_);
  bool cancelled_ SX_GUARDED_BY(mutex_) = false;
};
