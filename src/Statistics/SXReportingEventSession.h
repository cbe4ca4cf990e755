// What the analytics and power-log bridges read of the session a message was delivered to, so
// that they need nothing of the session class.
#pragma once

#include "sxreporting/types.h"

class SXReportingEventSession {
 public:
  virtual ~SXReportingEventSession() = default;
  // The name of the application the session reports for, or null.
  virtual SXValue hostApplicationName() const = 0;
};
