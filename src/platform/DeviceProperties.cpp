#include "platform/DeviceProperties.h"

#include <fstream>

SXJsonDeviceProperties::SXJsonDeviceProperties(const std::string& path) {
  std::ifstream in(path);
  if (!in) return;
  SXValue parsed = SXValue::parse(in, nullptr, false);
  if (parsed.is_object()) properties_ = std::move(parsed);
}

std::optional<SXValue> SXJsonDeviceProperties::property(const std::string& key) const {
  if (!properties_.is_object()) return std::nullopt;
  auto it = properties_.find(key);
  if (it == properties_.end()) return std::nullopt;
  return *it;
}
