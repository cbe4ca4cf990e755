// Value types shared by the reporting service and its clients.
#pragma once

#include <cstdint>
#include <functional>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>

// Payloads, configurations, defaults and reply dictionaries. Objects keep their keys sorted,
// which is the enumeration order everywhere in the service.
using SXValue = nlohmann::json;

using SXReportingServiceType = uint16_t;  // 0 "generic" ... 11 "test", 65535 "unknown"
using SXReportingCategory = uint32_t;     // upper 16 bits: component, lower 16 bits: category
using SXReportingMessageType = uint16_t;

inline constexpr SXReportingServiceType kSXReportingServiceTypeUnknown = 0xFFFF;

// The one error object of the protocol: reporting is disabled.
struct SXError {
  std::string domain;
  int64_t code = 0;
  bool operator==(const SXError&) const = default;
};

inline constexpr const char* kSXReportingErrorDomain = "com.vendra.audio.reporting";
inline constexpr int64_t kSXReportingErrorReportingDisabled = 1;

// A reply callback; `Reply<void>` is not used: every operation replies with a value.
template <typename T>
using Reply = std::function<void(T)>;

// Method names on the wire, in declaration order.
namespace sxr::method {
inline constexpr const char* kCreate = "createReportingSession:reply:";
inline constexpr const char* kSetServiceType = "setServiceType:reportingSession:reply:";
inline constexpr const char* kGetServiceType = "getServiceNameForReporterID:reply:";
inline constexpr const char* kSetConfiguration = "setConfiguration:forReporterID:reply:";
inline constexpr const char* kStart = "startReportingSessionForID:reply:";
inline constexpr const char* kSendMessage =
    "sendMessage:withCategory:andType:forReportingIDs:reply:";
inline constexpr const char* kStop = "stopReportingSessionForID:reply:";
inline constexpr const char* kDestroy = "destroyReportingSession:reply:";
inline constexpr const char* kValid = "reporterID:valid:";
inline constexpr const char* kGetAllReporters = "getAllReporters:";
inline constexpr const char* kKillService = "killService:";
// Read-only introspection, not one of the eleven reporting operations.
inline constexpr const char* kStatus = "status:";
}  // namespace sxr::method
