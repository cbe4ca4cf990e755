// The reply of `status:` as Prometheus metrics, for `sxreportctl status --metrics`. Kept out of
// the tool itself so that tests can reach it.
#pragma once

#include <string>

#include "sxreporting/types.h"

// The status in the Prometheus text exposition format, version 0.0.4: `sxreporting_up 1`, the
// enable switch as the gauge `sxreporting_reporting_enabled`, each entry of "counters" as the
// counter `sxreporting_<name>_total` and each entry of "gauges" as the gauge
// `sxreporting_<name>`. A nested object becomes one metric with a label per key (sink,
// guardrail or store for the counters the service knows, "kind" for any other). Absent,
// unknown and mistyped entries are tolerated: what is not a number is left out. Ends with a
// newline.
std::string SXCtlMetricsText(const SXValue& status);
