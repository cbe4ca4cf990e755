// The sxreportctl commands that talk to the service: one protocol operation each, its reply
// printed for people or as JSON.
#pragma once

#include "CtlArgs.h"

// Performs the request's operation on `client` (connected) and prints the outcome. Returns the
// exit status (SXCtlExit).
int SXCtlRunRemote(const SXCtlRequest& request, SXReportingClient& client);
