#include "fakes/FakeNotifications.h"

#include <cerrno>

#include "platform/InotifyNotifications.h"

int FakeNotifications::registerDispatch(const std::string& name, int& token,
                                        std::shared_ptr<SXWorkQueue> queue,
                                        SXNotifyHandler handler) {
  if (int status = SXInotifyNotifications::checkName(name)) return status;
  if (!queue || !handler) return EINVAL;
  SXMutexLock lock(mutex_);
  if (registerStatus_ != 0) return registerStatus_;
  token = nextToken_++;
  registrations_.emplace(name, Registration{token, std::move(queue), std::move(handler)});
  return 0;
}

int FakeNotifications::post(const std::string& name) {
  if (int status = SXInotifyNotifications::checkName(name)) return status;
  std::vector<Registration> due;
  {
    SXMutexLock lock(mutex_);
    posts_.push_back(name);
    auto [first, last] = registrations_.equal_range(name);
    for (auto it = first; it != last; ++it) due.push_back(it->second);
  }
  for (Registration& registration : due) {
    registration.queue->async([handler = std::move(registration.handler),
                               token = registration.token] { handler(token); });
  }
  return 0;
}

void FakeNotifications::failRegistrations(int status) {
  SXMutexLock lock(mutex_);
  registerStatus_ = status;
}

size_t FakeNotifications::registrationCount(const std::string& name) const {
  SXMutexLock lock(mutex_);
  return registrations_.count(name);
}

std::vector<std::string> FakeNotifications::posts() const {
  SXMutexLock lock(mutex_);
  return posts_;
}

void FakeNotifications::clear() {
  std::multimap<std::string, Registration> dropped;
  SXMutexLock lock(mutex_);
  dropped.swap(registrations_);
}
