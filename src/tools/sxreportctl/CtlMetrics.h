// `sxreportctl status --metrics`: the service's status as Prometheus metrics.
#pragma once

#include "client/SXCtlArgs.h"

// Asks `client` (connected) for the status and prints it in the Prometheus text format; --json
// does not apply. Returns the exit status (SXCtlExit); nothing is on stdout unless it is 0, so
// that a collector never reads half a scrape.
int SXCtlRunMetrics(const SXCtlRequest& request, SXReportingClient& client);
