// `sxreportctl status --metrics`: the service's status as Prometheus metrics.
#pragma once

#include <string>

#include "CtlArgs.h"

// The status in the Prometheus text exposition format, version 0.0.4: `sxreporting_up 1`, the
// enable switch as the gauge `sxreporting_reporting_enabled`, each entry of "counters" as the
// counter `sxreporting_<name>_total` and each entry of "gauges" as the gauge
// `sxreporting_<name>`. A nested object becomes one metric with a label per key (sink,
// guardrail or store for the counters the service knows, "kind" for any other). Absent,
// unknown and mistyped entries are tolerated: what is not a number is left out. Ends with a
// newline.
std::string SXCtlMetricsText(const SXValue& status);

// Asks `client` (connected) for the status and prints it in the Prometheus text format; --json
// does not apply. Returns the exit status (SXCtlExit); nothing is on stdout unless it is 0, so
// that a collector never reads half a scrape.
int SXCtlRunMetrics(const SXCtlRequest& request, SXReportingClient& client);
