// `sxreportctl status --metrics`: the service's status as Prometheus metrics.
#pragma once

#include "client/SXCtlArgs.h"

// Asks `client` (connected) for the status and prints it in the Prometheus text format; --json
// does not apply. Returns the exit status: 0 replied, 1 no reply in time, 2 connection or
// request error (with nothing on stdout, so that a collector never reads half a scrape).
int SXCtlRunMetrics(const SXCtlRequest& request, SXReportingClient& client);
