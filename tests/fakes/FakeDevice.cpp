#include "fakes/FakeDevice.h"


void FakeOrientationService::registerDeviceOrientationCallback(const std::string& id,
                                                               SXOrientationCallback cb) {
  SXMutexLock lock(mutex_);
  device_[id] = std::move(cb);
  calls_.push_back("registerDevice " + id);
}

void FakeOrientationService::registerInterfaceOrientationCallback(const std::string& id,
                                                                  SXOrientationCallback cb) {
  SXMutexLock lock(mutex_);
  interface_[id] = std::move(cb);
  calls_.push_back("registerInterface " + id);
}

void FakeOrientationService::unregisterDeviceOrientationCallback(const std::string& id) {
  SXOrientationCallback dropped;
  SXMutexLock lock(mutex_);
  if (auto it = device_.find(id); it != device_.end()) {
    dropped = std::move(it->second);
    device_.erase(it);
  }
  calls_.push_back("unregisterDevice " + id);
}

void FakeOrientationService::unregisterInterfaceOrientationCallback(const std::string& id) {
  SXOrientationCallback dropped;
  SXMutexLock lock(mutex_);
  if (auto it = interface_.find(id); it != interface_.end()) {
    dropped = std::move(it->second);
    interface_.erase(it);
  }
  calls_.push_back("unregisterInterface " + id);
}

bool FakeOrientationService::fireDevice(const std::string& id, int32_t orientation) {
  SXOrientationCallback cb;
  {
    SXMutexLock lock(mutex_);
    auto it = device_.find(id);
    if (it == device_.end()) return false;
    cb = it->second;
  }
  cb(orientation);
  return true;
}

bool FakeOrientationService::fireInterface(const std::string& id, int32_t orientation) {
  SXOrientationCallback cb;
  {
    SXMutexLock lock(mutex_);
    auto it = interface_.find(id);
    if (it == interface_.end()) return false;
    cb = it->second;
  }
  cb(orientation);
  return true;
}

std::vector<std::string> FakeOrientationService::calls() const {
  SXMutexLock lock(mutex_);
  return calls_;
}

void FakeOrientationService::clear() {
  std::map<std::string, SXOrientationCallback> device, interface;
  SXMutexLock lock(mutex_);
  device.swap(device_);
  interface.swap(interface_);
}
