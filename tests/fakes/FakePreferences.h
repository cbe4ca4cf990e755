// An in-memory preferences store. Refuses the domain names the production store refuses,
// counts reads (so tests can tell a re-read happened) and fails writes on request.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "common/SXThreadSafety.h"
#include "platform/Preferences.h"

class FakePreferences final : public SXPreferences {
 public:
  std::optional<SXValue> copyValue(const std::string& domain, const std::string& key) override;
  SXValue copyDomain(const std::string& domain) override;
  std::optional<std::string> setValue(const std::string& domain, const std::string& key,
                                      const std::optional<SXValue>& value) override;

  // Every later setValue fails with `error` (nothing: writes succeed again).
  void failWrites(std::optional<std::string> error);
  // Number of copyValue and copyDomain calls so far.
  size_t reads() const;

 private:
  mutable SXMutex mutex_;
  std::map<std::string, SXValue> domains_ SX_GUARDED_BY(mutex_);
  std::optional<std::string> writeFailure_ SX_GUARDED_BY(mutex_);
  size_t reads_ SX_GUARDED_BY(mutex_) = 0;
};
