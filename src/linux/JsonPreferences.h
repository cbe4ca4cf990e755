// Production preferences store: one JSON object per domain in `<directory>/<domain>.json`
// (`<config-dir>/preferences/`, for root `<state-dir>/preferences/`, unless --preferences-dir
// says otherwise).
//
// Every read opens the file afresh, because other processes (the admin tool, another daemon)
// change it. Writes hold an exclusive flock on `<domain>.json.lock` across read-modify-write
// and replace the file atomically, so two writers in different processes never lose each
// other's keys and readers see either the old or the new object, never a torn one.
//
// All methods may be called from any thread. On failure: reads give nothing (an empty
// dictionary for copyDomain) and setValue returns the failure's description. A file that is
// not a JSON object reads as empty and logs one error line per read on the default log;
// setValue refuses to replace it (or a file it cannot read), so nothing in it is lost. A
// domain name that is empty, "." or "..", or holds "/" or a NUL byte is refused.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/Log.h"
#include "platform/Preferences.h"

class SXJsonPreferences final : public SXPreferences {
 public:
  SXJsonPreferences(std::string directory, std::shared_ptr<SXLogFacility> log);

  std::optional<SXValue> copyValue(const std::string& domain, const std::string& key) override;
  SXValue copyDomain(const std::string& domain) override;
  SXStatus setValue(const std::string& domain, const std::string& key,
                    const std::optional<SXValue>& value) override;

  // Whether `domain` may name a file of its own in the preferences directory.
  static bool isValidDomain(const std::string& domain);

 private:
  std::string domainPath(const std::string& domain) const;
  // The domain's object; empty when the file is absent, unreadable or malformed. An unreadable
  // or malformed file also sets `unusable` (when given) to why.
  SXValue readDomain(const std::string& path, std::string* unusable = nullptr);

  const std::string directory_;  // immutable
  const std::shared_ptr<SXLogFacility> log_;
};
