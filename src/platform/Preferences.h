// The shared preferences store: values by domain and key that other processes can change.
// All methods may be called from any thread.
#pragma once

#include <optional>
#include <string>

#include "platform/Status.h"
#include "sxreporting/types.h"

class SXPreferences {
 public:
  virtual ~SXPreferences() = default;
  // The stored value, or nothing when the domain holds none for `key`.
  virtual std::optional<SXValue> copyValue(const std::string& domain, const std::string& key) = 0;
  // The whole domain as a dictionary (empty when it holds nothing).
  virtual SXValue copyDomain(const std::string& domain) = 0;
  // Stores `value` (nothing: removes the key).
  virtual SXStatus setValue(const std::string& domain, const std::string& key,
                            const std::optional<SXValue>& value) = 0;
};

// A stored value read as a string: strings as they are, numbers in decimal (floating values in
// the shortest form that reads back exactly); nothing for booleans, null, arrays and
// dictionaries.
std::optional<std::string> SXPreferencesValueAsString(const SXValue& value);
// A stored value read as a boolean: booleans; numbers (non-zero is true); the strings
// "YES"/"true"/"1" and "NO"/"false"/"0" in any case. Anything else reads as false.
bool SXPreferencesValueAsBool(const SXValue& value);
