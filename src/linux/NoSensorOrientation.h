// The production orientation service. All methods may be called from any thread.
#pragma once

#include <cstdint>
#include <string>

#include "platform/Orientation.h"

// Production: the device has no orientation sensor. Registrations succeed; no callback comes.
class SXNoSensorOrientationService final : public SXOrientationService {
 public:
  void registerDeviceOrientationCallback(const std::string&, SXOrientationCallback) override {}
  void registerInterfaceOrientationCallback(const std::string&, SXOrientationCallback) override {}
  void unregisterDeviceOrientationCallback(const std::string&) override {}
  void unregisterInterfaceOrientationCallback(const std::string&) override {}
  std::string orientationName(int32_t orientation) const override;
};
