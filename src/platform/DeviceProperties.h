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

// Production: the JSON object in `<config-dir>/device.json`, read once at construction.
// An absent or unreadable file answers nothing for every key.
class SXJsonDeviceProperties final : public SXDeviceProperties {
 public:
  explicit SXJsonDeviceProperties(const std::string& path);
  std::optional<SXValue> property(const std::string& key) const override;

 private:
  SXValue properties_;
};
