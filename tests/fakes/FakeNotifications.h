// In-process named notifications: `post` hands each registration of the name its token on the
// registration's queue at once. Names are checked as the production adapter checks them;
// registrations fail with a chosen status on request.
#pragma once

#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Notify.h"

class FakeNotifications final : public SXNotifications {
 public:
  int registerDispatch(const std::string& name, int& token, std::shared_ptr<SXWorkQueue> queue,
                       SXNotifyHandler handler) override;
  int post(const std::string& name) override;

  // Every later registration fails with `status` (0: registrations succeed again).
  void failRegistrations(int status);
  size_t registrationCount(const std::string& name) const;
  // The names posted successfully, in order.
  std::vector<std::string> posts() const;
  // Drops every registration (and what its handler holds).
  void clear();

 private:
  struct Registration {
    int token;
    std::shared_ptr<SXWorkQueue> queue;
    SXNotifyHandler handler;
  };

  mutable SXMutex mutex_;
  std::multimap<std::string, Registration> registrations_ SX_GUARDED_BY(mutex_);
  std::vector<std::string> posts_ SX_GUARDED_BY(mutex_);
  int registerStatus_ SX_GUARDED_BY(mutex_) = 0;
  int nextToken_ SX_GUARDED_BY(mutex_) = 1;
};
