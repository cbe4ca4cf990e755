// Names of service types, as the service logs and stores them and the tools print and accept
// them.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "sxreporting/types.h"

// "generic" ... "test", "unknown" for 65535; codes 12-65534 are named "servicetype<code>".
// The reference stays valid for the life of the process.
const std::string& SXServiceTypeName(SXReportingServiceType serviceType);

// "generic, vokira, ..., test, unknown": every name, for messages that list them.
const std::string& SXServiceTypeNameList();

// A service type from a decimal code (0-65535), a name or "servicetype<code>", in any case;
// nothing otherwise.
std::optional<SXReportingServiceType> SXServiceTypeFromText(std::string_view text);
