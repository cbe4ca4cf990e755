// Placeholder until the driver statistics land.
#pragma once
#include <optional>
#include "SXReportingEnvironment.h"
class SXReportingDriverUtility {
 public:
  explicit SXReportingDriverUtility(SXReportingEnvironment&) {}
  SXValue getSnapShot() { return SXValue::object(); }
  std::optional<SXValue> getDriverStatisticsRelativeToSnapShot(const std::optional<SXValue>&) {
    return std::nullopt;
  }
};
