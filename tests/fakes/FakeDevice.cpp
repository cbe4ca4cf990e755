#include "fakes/FakeDevice.h"

void FakeOrientationService::add(bool interface, const std::string& id, SXOrientationCallback cb) {
  SXMutexLock lock(mutex_);
  callbacks(interface)[id] = std::move(cb);
}

void FakeOrientationService::remove(bool interface, const std::string& id) {
  SXOrientationCallback dropped;  // released once the lock is
  SXMutexLock lock(mutex_);
  if (auto it = callbacks(interface).find(id); it != callbacks(interface).end()) {
    dropped = std::move(it->second);
    callbacks(interface).erase(it);
  }
}

bool FakeOrientationService::fire(bool interface, const std::string& id, int32_t orientation) {
  SXOrientationCallback cb;
  {
    SXMutexLock lock(mutex_);
    auto it = callbacks(interface).find(id);
    if (it == callbacks(interface).end()) return false;
    cb = it->second;
  }
  cb(orientation);
  return true;
}

void FakeOrientationService::clear() {
  Callbacks device, interface;
  SXMutexLock lock(mutex_);
  device.swap(device_);
  interface.swap(interface_);
}
