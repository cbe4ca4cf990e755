// Device properties from a JSON file. May be called from any thread.
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "common/SXThreadSafety.h"
#include "platform/DeviceProperties.h"
#include "sxreporting/types.h"

// Production: the JSON object in `<config-dir>/device.json`, read at construction and again
// by reload(). An absent or unreadable file answers nothing for every key.
class SXJsonDeviceProperties final : public SXDeviceProperties {
 public:
  explicit SXJsonDeviceProperties(std::string path);
  std::optional<SXValue> property(const std::string& key) const override;
  // Reads the file again; returns whether the answers changed. Any thread.
  bool reload();

 private:
  const std::string path_;
  mutable SXMutex mutex_;
  SXValue properties_ SX_GUARDED_BY(mutex_);
};
