// How many error lines one client may cause: the first `perMinute` of each minute are written,
// the rest only counted, and their number is written in one line when the minute is over or
// the client goes. A client that sends thousands of bad reporter IDs a second thus costs a
// few lines, not megabytes of log.
//
// Threads: one at a time (a client's: the server queue, and its owner's destructor).
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "SXReportingEnvironment.h"

class SXReportingErrorLines {
 public:
  // `source` names who caused the lines in the summary line, e.g. "client 42".
  SXReportingErrorLines(uint64_t perMinute, std::string source)
      : perMinute_(perMinute), source_(std::move(source)) {}

  // Whether the next error line of this client may be written. Counts it when not.
  bool allow(SXReportingEnvironment& environment);
  // Writes the count of lines held back, if any.
  void reportSuppressed(SXReportingEnvironment& environment);

 private:
  const uint64_t perMinute_;
  const std::string source_;
  std::optional<SXDate> minuteStart_;
  uint64_t written_ = 0;
  uint64_t suppressed_ = 0;
};
