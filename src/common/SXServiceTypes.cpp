#include "common/SXServiceTypes.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <map>
#include <mutex>

namespace {

const std::array<std::string, 12> kNames = {"generic",          "vokira",        "telephony",
                                            "haptics",          "alarms",        "standalone",
                                            "soundautoconfig",  "longformaudio", "nonlongformaudio",
                                            "audiodeviceusage", "alerts",        "test"};

const std::string kUnknownName = "unknown";

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) ==
                  std::tolower(static_cast<unsigned char>(y));
         });
}

// Names of codes outside the table, made on first use and kept so callers can hold references.
const std::string& outOfTableName(SXReportingServiceType serviceType) {
  static std::mutex mutex;
  static std::map<SXReportingServiceType, std::string> names;
  std::lock_guard lock(mutex);
  auto [it, inserted] = names.try_emplace(serviceType);
  if (inserted) it->second = "servicetype" + std::to_string(serviceType);
  return it->second;
}

}  // namespace

const std::string& SXServiceTypeName(SXReportingServiceType serviceType) {
  if (serviceType < kNames.size()) return kNames[serviceType];
  if (serviceType == kSXReportingServiceTypeUnknown) return kUnknownName;
  return outOfTableName(serviceType);
}

const std::string& SXServiceTypeNameList() {
  static const std::string kList = [] {
    std::string list;
    for (const std::string& name : kNames) list += name + ", ";
    return list + kUnknownName;
  }();
  return kList;
}

std::optional<SXReportingServiceType> SXServiceTypeFromText(std::string_view text) {
  // A code as it stands, or as it is named outside the table.
  constexpr std::string_view kCodePrefix = "servicetype";
  std::string_view digits = text;
  if (equalsIgnoringCase(text.substr(0, kCodePrefix.size()), kCodePrefix)) {
    digits.remove_prefix(kCodePrefix.size());
  }
  unsigned code = 0;
  auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), code);
  if (!digits.empty() && ec == std::errc() && end == digits.data() + digits.size()) {
    if (code > 0xFFFF) return std::nullopt;
    return static_cast<SXReportingServiceType>(code);
  }
  for (size_t i = 0; i < kNames.size(); ++i) {
    if (equalsIgnoringCase(text, kNames[i])) return static_cast<SXReportingServiceType>(i);
  }
  if (equalsIgnoringCase(text, kUnknownName)) return kSXReportingServiceTypeUnknown;
  return std::nullopt;
}
