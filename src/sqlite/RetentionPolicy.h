// How long the daemon keeps what it writes: rows of the three SQLite stores, session summary
// files and the damaged copies of stores that were moved aside. It is the "retention" section
// of <config-dir>/sxreportingd.json:
//
//   {"retention": {"intervalSeconds": 60,
//                  "analytics":     {"maxAgeDays": 30, "maxBytes": 268435456},
//                  "powerLog":      {"maxAgeDays": 30, "maxBytes": 268435456},
//                  "spool":         {"maxAgeDays": 30, "maxBytes": 268435456},
//                  "summaryFiles":  {"maxAgeDays": 30, "maxFiles": 1000},
//                  "damagedCopies": {"maxAgeDays": 30}}}
//
// Every key is optional; a missing one keeps its default. Plain values, no threads.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/Log.h"
#include "platform/Status.h"
#include "sxreporting/types.h"

// A store's rows older than `maxAgeDays`, and its oldest rows while it holds more than
// `maxBytes`, are deleted.
struct SXStoreRetention {
  double maxAgeDays = 30;
  uint64_t maxBytes = uint64_t{256} << 20;
  bool operator==(const SXStoreRetention&) const = default;
};

// Files older than `maxAgeDays` are deleted, and the oldest beyond `maxFiles` (0: no count cap).
struct SXFileRetention {
  double maxAgeDays = 30;
  uint64_t maxFiles = 0;
  bool operator==(const SXFileRetention&) const = default;
};

struct SXRetentionPolicy {
  SXStoreRetention analytics;  // tallyvane.db
  SXStoreRetention powerLog;   // joulebook.db
  SXStoreRetention spool;      // fernreporting.db, beside what the backends have taken
  SXFileRetention summaryFiles{30, 1000};
  SXFileRetention damagedCopies{30, 0};
  double intervalSeconds = 60;  // between two passes

  // The policy `section` describes (a JSON object, or null for all defaults). On an unknown
  // key or a bad value the failure says which, e.g.
  // "retention.analytics.maxBytes: expected a positive integer, got -1".
  static SXResult<SXRetentionPolicy> fromJson(const SXValue& section);

  // The policy of the "retention" section of the daemon's configuration file `file` (an
  // object): the defaults when it has none; a failure when it is bad.
  static SXResult<SXRetentionPolicy> fromConfigFile(const SXValue& file);

  // One line for the log, e.g. "analytics 30 days or 268435456 bytes, ...".
  std::string description() const;

  bool operator==(const SXRetentionPolicy&) const = default;
};
