#include "fakes/FakePreferences.h"

#include "platform/JsonPreferences.h"

std::optional<SXValue> FakePreferences::copyValue(const std::string& domain,
                                                  const std::string& key) {
  SXMutexLock lock(mutex_);
  ++reads_;
  auto domainIt = domains_.find(domain);
  if (domainIt == domains_.end()) return std::nullopt;
  auto it = domainIt->second.find(key);
  if (it == domainIt->second.end()) return std::nullopt;
  return *it;
}

SXValue FakePreferences::copyDomain(const std::string& domain) {
  SXMutexLock lock(mutex_);
  ++reads_;
  auto it = domains_.find(domain);
  return it == domains_.end() ? SXValue::object() : it->second;
}

std::optional<std::string> FakePreferences::setValue(const std::string& domain,
                                                     const std::string& key,
                                                     const std::optional<SXValue>& value) {
  if (!SXJsonPreferences::isValidDomain(domain)) {
    return "preferences domain \"" + domain + "\" is not a valid name";
  }
  SXMutexLock lock(mutex_);
  if (writeFailure_) return writeFailure_;
  SXValue& object = domains_.try_emplace(domain, SXValue::object()).first->second;
  if (value) {
    object[key] = *value;
  } else {
    object.erase(key);
  }
  return std::nullopt;
}

void FakePreferences::failWrites(std::optional<std::string> error) {
  SXMutexLock lock(mutex_);
  writeFailure_ = std::move(error);
}

size_t FakePreferences::reads() const {
  SXMutexLock lock(mutex_);
  return reads_;
}
