// System-wide named notifications, posted by any process and delivered with a registration
// token. All methods may be called from any thread.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/Dispatch.h"

using SXNotifyHandler = std::function<void(int token)>;

class SXNotifications {
 public:
  virtual ~SXNotifications() = default;
  // Registers `handler` for `name`, delivered on `queue`; stores the token in `token`.
  // Returns 0 on success, a non-zero status otherwise.
  virtual int registerDispatch(const std::string& name, int& token,
                               std::shared_ptr<SXWorkQueue> queue, SXNotifyHandler handler) = 0;
  // Posts `name` to every registration in every process. Returns 0 on success.
  virtual int post(const std::string& name) = 0;
};
