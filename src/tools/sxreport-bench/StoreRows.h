// Counts, read-only, the rows a benchmark run left in the daemon's analytics store
// (tallyvane.db, table events) and server-reporting spool (fernreporting.db, table messages).
// Only rows newer than mark() count, so a daemon that already holds rows can be measured.
//
// Threads: one owner. Failures (a store that cannot be read) come back as error text.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

#include "platform/Status.h"

struct StoreCounts {
  int64_t tallyvane = 0;
  int64_t fernReporting = 0;
};

class StoreRows {
 public:
  // Rows are those of analytics event `eventName` and of spool category/type `category`,`type`.
  StoreRows(std::string stateDir, std::string eventName, int64_t category, int64_t type);

  // Remembers the newest row of each store; later counts see only rows after it.
  SXStatus mark();
  // The rows of the run so far.
  SXResult<StoreCounts> count() const;
  // Polls until both stores hold `expected` rows, or no new row has come for `quiet`.
  // Returns the last counts; `error` is set when a store could not be read.
  StoreCounts waitFor(const StoreCounts& expected, std::chrono::milliseconds quiet,
                      std::string& error) const;

 private:
  // The integer column "n" of the one row `sql` returns from the store file `db`; 0 when
  // there is no such row or no such file yet.
  SXResult<int64_t> query(const std::string& db, const std::string& sql) const;

  const std::string stateDir_;
  const std::string eventName_;
  const int64_t category_;
  const int64_t type_;
  StoreCounts mark_;  // the newest row ids at mark()
};
