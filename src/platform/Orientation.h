// The orientation service: device and interface orientation callbacks by identifier.
// Callbacks run on threads of the service. All methods may be called from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

using SXOrientationCallback = std::function<void(int32_t orientation)>;

class SXOrientationService {
 public:
  virtual ~SXOrientationService() = default;
  virtual void registerDeviceOrientationCallback(const std::string& id,
                                                 SXOrientationCallback callback) = 0;
  virtual void registerInterfaceOrientationCallback(const std::string& id,
                                                    SXOrientationCallback callback) = 0;
  virtual void unregisterDeviceOrientationCallback(const std::string& id) = 0;
  virtual void unregisterInterfaceOrientationCallback(const std::string& id) = 0;
  virtual std::string orientationName(int32_t orientation) const = 0;
};
