// The power log (Joulebook). May be called from any thread.
#pragma once

#include <optional>
#include <string>

#include "sxreporting/types.h"

class SXJoulebook {
 public:
  virtual ~SXJoulebook() = default;
  // Logs `entry` under the registered event `event` of client `clientID`. Failures are the
  // log's own business (it logs them); nothing is returned.
  virtual void logRegisteredEvent(int clientID, const std::string& event, const SXValue& entry,
                                  const std::optional<SXValue>& filter) = 0;
};
