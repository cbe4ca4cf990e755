// The reply of `status:` for people.
#pragma once

#include <string>

#include "sxreporting/types.h"

// Clients with their sessions, the enable switch, the defaults and the counters, without a
// final newline. Tolerates missing or mistyped entries: they print as "unknown" or "(none)".
std::string SXCtlStatusText(const SXValue& status);
