// Doubles of the small platform facilities: device properties, process information, the file
// system, the orientation service, analytics events and the power log.
#pragma once

#include <atomic>
#include <map>
#include <mutex>

#include "common/SXThreadSafety.h"
#include "platform/DeviceProperties.h"
#include "platform/FileSystem.h"
#include "platform/Joulebook.h"
#include "platform/Orientation.h"
#include "platform/ProcessInfo.h"
#include "platform/Tallyvane.h"

class FakeDeviceProperties final : public SXDeviceProperties {
 public:
  explicit FakeDeviceProperties(SXValue properties = SXValue::object())
      : properties_(std::move(properties)) {}
  std::optional<SXValue> property(const std::string& key) const override {
    auto it = properties_.find(key);
    if (it == properties_.end()) return std::nullopt;
    return *it;
  }

 private:
  const SXValue properties_;  // never changed: read from any thread
};

// No other process has a name, and the test's own never exits.
class FakeProcessInfo final : public SXProcessInfo {
 public:
  int32_t processIdentifier() const override { return 4242; }
  std::string processName() const override { return "sxreportingd"; }
  std::optional<std::string> commandName(int32_t) const override { return std::nullopt; }
  void exitProcess(int) override {}
};

// Files in memory.
class FakeFileSystem final : public SXFileSystem {
 public:
  SXStatus createDirectory(const std::string&, unsigned) override { return {}; }
  SXStatus writeFileAtomically(const std::string& path, const std::string& contents) override {
    SXMutexLock lock(mutex_);
    files[path] = contents;
    return {};
  }

  SXStatus writeNewFileAtomically(const std::string& path, const std::string& contents,
                                  bool& taken) override {
    SXMutexLock lock(mutex_);
    taken = !files.try_emplace(path, contents).second;
    return {};
  }

  SXMutex mutex_;
  std::map<std::string, std::string> files;
};

// Holds registrations; a test fires callbacks from any thread.
class FakeOrientationService final : public SXOrientationService {
 public:
  void registerDeviceOrientationCallback(const std::string& id, SXOrientationCallback cb) override {
    set({false, id}, std::move(cb));
  }
  void registerInterfaceOrientationCallback(const std::string& id,
                                            SXOrientationCallback cb) override {
    set({true, id}, std::move(cb));
  }
  void unregisterDeviceOrientationCallback(const std::string& id) override { set({false, id}); }
  void unregisterInterfaceOrientationCallback(const std::string& id) override { set({true, id}); }
  std::string orientationName(int32_t orientation) const override {
    return "orientation" + std::to_string(orientation);
  }

  // Calls the registered callback, if any; returns whether one was registered.
  bool fireDevice(const std::string& id, int32_t orientation) {
    return fire({false, id}, orientation);
  }
  bool fireInterface(const std::string& id, int32_t orientation) {
    return fire({true, id}, orientation);
  }
  // Drops every registration (callbacks hold their sessions).
  void clear() {
    Callbacks dropped;  // released once the lock is
    SXMutexLock lock(mutex_);
    dropped.swap(callbacks_);
  }

 private:
  using Key = std::pair<bool, std::string>;  // (of the interface orientation, id)
  using Callbacks = std::map<Key, SXOrientationCallback>;
  // Registers `cb`, or with none removes the registration.
  void set(const Key& key, SXOrientationCallback cb = nullptr) {
    Callbacks::node_type dropped;  // released once the lock is
    SXMutexLock lock(mutex_);
    dropped = callbacks_.extract(key);
    if (cb) callbacks_[key] = std::move(cb);
  }
  bool fire(const Key& key, int32_t orientation) {
    SXOrientationCallback cb;
    {
      SXMutexLock lock(mutex_);
      auto it = callbacks_.find(key);
      if (it == callbacks_.end()) return false;
      cb = it->second;
    }
    cb(orientation);
    return true;
  }

  mutable SXMutex mutex_;
  Callbacks callbacks_ SX_GUARDED_BY(mutex_);
};

// Counts analytics events, making each one's payload at once on the caller's thread.
class FakeTallyvane final : public SXTallyvane {
 public:
  bool sendEventLazy(const std::string&, SXPayloadProvider provider) override {
    if (provider) provider();
    ++events_;
    return true;
  }
  size_t eventCount() const { return events_; }

 private:
  std::atomic<size_t> events_{0};
};

// Takes power-log entries and keeps nothing of them.
class FakeJoulebook final : public SXJoulebook {
 public:
  void logRegisteredEvent(int, const std::string&, const SXValue&,
                          const std::optional<SXValue>&) override {}
};
