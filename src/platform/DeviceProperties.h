// Device properties ("InternalBuild", "DeviceClassNumber"). May be called from any thread.
#pragma once

#include <optional>
#include <string>

#include "sxreporting/types.h"

class SXDeviceProperties {
 public:
  virtual ~SXDeviceProperties() = default;
  // The property's value, or nothing when the device gives no answer.
  virtual std::optional<SXValue> property(const std::string& key) const = 0;
};
