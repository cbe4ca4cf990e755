// Names of service types as the client tools print and accept them. The service keeps its own
// table; this copy lets the client library stand without the service's code.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "sxreporting/types.h"

// "generic" ... "test", "unknown" for 65535, "servicetype<N>" for codes without a name.
std::string SXClientServiceTypeName(SXReportingServiceType serviceType);

// A service type from a decimal code (0-65535) or a name, in any case; nothing otherwise.
std::optional<SXReportingServiceType> SXClientServiceTypeFromText(std::string_view text);
