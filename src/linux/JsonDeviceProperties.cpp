#include "linux/JsonDeviceProperties.h"

#include <fstream>

SXJsonDeviceProperties::SXJsonDeviceProperties(std::string path) : path_(std::move(path)) {
  reload();
}

bool SXJsonDeviceProperties::reload() {
  SXValue parsed;
  if (std::ifstream in(path_); in) parsed = SXValue::parse(in, nullptr, false);
  if (!parsed.is_object()) parsed = nullptr;
  SXMutexLock lock(mutex_);
  if (parsed == properties_) return false;
  properties_ = std::move(parsed);
  return true;
}

std::optional<SXValue> SXJsonDeviceProperties::property(const std::string& key) const {
  SXMutexLock lock(mutex_);
  if (!properties_.is_object()) return std::nullopt;
  auto it = properties_.find(key);
  if (it == properties_.end()) return std::nullopt;
  return *it;
}
