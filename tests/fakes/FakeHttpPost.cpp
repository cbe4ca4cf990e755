#include "fakes/FakeHttpPost.h"

SXHttpResult FakeHttpPost::post(const SXHttpRequest& request) {
  SXMutexLock lock(mutex_);
  requests_.push_back(request);
  if (cancelled_) return {std::nullopt, {}, "", "cancelled"};
  if (script_.empty()) return {200, {}, "", ""};
  SXHttpResult result = script_.front();
  script_.pop_front();
  return result;
}

void FakeHttpPost::cancel() {
  SXMutexLock lock(mutex_);
  cancelled_ = true;
}

void FakeHttpPost::answer(int status, std::string body,
                          std::map<std::string, std::string> headers) {
  SXMutexLock lock(mutex_);
  script_.push_back({status, std::move(headers), std::move(body), ""});
}

void FakeHttpPost::fail(std::string error) {
  SXMutexLock lock(mutex_);
  script_.push_back({std::nullopt, {}, "", std::move(error)});
}

void FakeHttpPost::timeOut() {
  SXMutexLock lock(mutex_);
  script_.push_back({std::nullopt, {}, "", "timed out", true});
}

std::vector<SXHttpRequest> FakeHttpPost::requests() const {
  SXMutexLock lock(mutex_);
  return requests_;
}

bool FakeHttpPost::cancelled() const {
  SXMutexLock lock(mutex_);
  return cancelled_;
}
