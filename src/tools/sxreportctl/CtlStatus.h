// The reply of `status:` for people.
#pragma once

#include <string>

#include "sxreporting/types.h"

// Clients with their sessions, the enable switch, the defaults, the counters and the gauges
// (labelled metrics as indented blocks), without a final newline. Tolerates missing or
// mistyped entries: they print as "unknown" or "(none)".
std::string SXCtlStatusText(const SXValue& status);
