// The command line of sxreportctl: commands chained by `then`, their arguments and their help.
// Kept out of main.cpp so that tests can reach it; pure apart from reading the environment in
// SXCtlPaths and the clock for `events --since AGE`.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "common/SXPaths.h"
#include "sxreporting/client.h"

struct SXCtlRequest {
  std::string command;  // "create", "send", ...

  // Global options.
  std::optional<std::string> socketPath;
  std::optional<std::string> stateDir;
  std::optional<std::string> configDir;
  std::optional<std::string> runtimeDir;
  std::optional<std::string> preferencesDir;
  bool json = false;
  std::optional<double> timeoutSeconds;  // 0: wait without limit

  // Arguments; each is set only by the commands that take it.
  int64_t reporterID = 0;
  SXReportingServiceType serviceType = 0;
  std::optional<SXValue> configuration;             // configure: nothing when the JSON is null
  SXValue payload;                                  // send
  SXReportingCategory category = 3;                 // send: "Playback"
  SXReportingMessageType messageType = 1;           // send: "Start"
  std::optional<std::vector<int64_t>> reporterIDs;  // send: nothing means broadcast
  std::optional<std::string> eventName;             // events
  std::optional<int64_t> limit;                     // events: the newest N only
  std::optional<double> since;                      // events: seconds since the epoch
  std::string defaultsAction;                       // defaults: "read", "write" or "delete"
  std::optional<std::string> key;                   // defaults
  SXValue value;                                    // defaults write
  std::string notificationName;                     // notify
  bool metrics = false;                             // status: Prometheus text, not prose
};

// How sxreportctl ends, so that scripts can tell the outcomes apart.
enum SXCtlExit : int {
  kSXCtlOK = 0,           // the service replied true or answered; a local command did its job
  kSXCtlFailed = 1,       // the service replied false, or refused the message (send)
  kSXCtlUsage = 2,        // the command line is wrong
  kSXCtlUnreachable = 3,  // no connection to the service, or it closed the connection
  kSXCtlNoReply = 4,      // no reply within the time-out
  kSXCtlNotSet = 5,       // defaults read KEY: the key is not set
  kSXCtlRejected = 6,     // the service refused the request as malformed, or replied nonsense
  kSXCtlLocalError = 7,   // a local store or file could not be read or written
};

// The exit status of a call that did not reply (kSXCtlOK for one that did).
SXCtlExit SXCtlExitFor(SXCallStatus status);

// What a command line asks for: the requests to run in order, or else (`exitStatus` set) a
// text to print and the status to exit with: the help or the version (kSXCtlOK, for standard
// output), or a one-line usage error (kSXCtlUsage, for standard error).
struct SXCtlCommandLine {
  std::vector<SXCtlRequest> requests;
  std::optional<int> exitStatus;
  std::string text;
};

// Parses the arguments that follow the program name: commands joined by the word "then"
// ("create 42 then start 42"), which run in order on one connection, since a session lives
// only as long as the connection that created it. Global options anywhere apply to every
// command. After "--", "then" is an argument.
SXCtlCommandLine SXCtlParseChain(const std::vector<std::string>& args);

// The time `text` names, in seconds since the epoch: a UTC date and time in ISO 8601
// ("2026-11-25", "2026-11-25T06:30", "2026-11-25T06:30:15Z"; a space may stand for the T),
// or a time before `now` ("90s", "10m", "2h", "3d"). On failure returns false and says why.
bool SXCtlParseSince(const std::string& text, double now, double& since, std::string& error);

// How long the command waits for its reply: --timeout when given (0: no limit), else no limit
// for `start` (its reply comes when the session stops) and 5 s for everything else.
SXTimeout SXCtlTimeout(const SXCtlRequest& request);

// The directories and socket: the flags over the environment over the defaults.
SXPaths SXCtlPaths(const SXCtlRequest& request);

inline constexpr const char* kSXCtlPreferencesDomain = "com.vendra.sonex";
