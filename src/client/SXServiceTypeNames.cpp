#include "client/SXServiceTypeNames.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>

namespace {

constexpr std::array<std::string_view, 12> kNames = {
    "generic",          "vokira",           "telephony",       "haptics",
    "alarms",           "standalone",       "soundautoconfig", "longformaudio",
    "nonlongformaudio", "audiodeviceusage", "alerts",          "test"};

constexpr std::string_view kUnknownName = "unknown";

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) ==
                  std::tolower(static_cast<unsigned char>(y));
         });
}

}  // namespace

std::string SXClientServiceTypeName(SXReportingServiceType serviceType) {
  if (serviceType < kNames.size()) return std::string(kNames[serviceType]);
  if (serviceType == kSXReportingServiceTypeUnknown) return std::string(kUnknownName);
  return "servicetype" + std::to_string(serviceType);
}

std::optional<SXReportingServiceType> SXClientServiceTypeFromText(std::string_view text) {
  unsigned code = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), code);
  if (!text.empty() && ec == std::errc() && end == text.data() + text.size()) {
    if (code > 0xFFFF) return std::nullopt;
    return static_cast<SXReportingServiceType>(code);
  }
  for (size_t i = 0; i < kNames.size(); ++i) {
    if (equalsIgnoringCase(text, kNames[i])) return static_cast<SXReportingServiceType>(i);
  }
  if (equalsIgnoringCase(text, kUnknownName)) return kSXReportingServiceTypeUnknown;
  return std::nullopt;
}
