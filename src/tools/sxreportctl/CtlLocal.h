// The sxreportctl commands that work on the service's files, not through its socket.
// Each returns the exit status (SXCtlExit), and prints what went wrong.
#pragma once

#include "CtlArgs.h"

// `events`: the analytics events stored in <state-dir>/tallyvane.db.
int SXCtlRunEvents(const SXCtlRequest& request, const SXPaths& paths);

// `sizes`: rows, oldest row and bytes of each store in <state-dir>.
int SXCtlRunSizes(const SXCtlRequest& request, const SXPaths& paths);

// `defaults read|write|delete`: the preferences domain, one JSON object in
// <preferences-dir>/com.vendra.sonex.json, replaced atomically on every change.
int SXCtlRunDefaults(const SXCtlRequest& request, const SXPaths& paths);

// `notify NAME`: touches <runtime-dir>/notify/NAME so that watchers of the name wake.
int SXCtlRunNotify(const SXCtlRequest& request, const SXPaths& paths);
