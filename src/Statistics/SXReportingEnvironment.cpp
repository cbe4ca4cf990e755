#include "SXReportingEnvironment.h"

SXReportingEnvironment::SXReportingEnvironment(SXPlatform platform, SXReportingLimits limits)
    : platform_(std::move(platform)),
      limits_(std::make_shared<const SXReportingLimits>(limits)) {
  if (platform_.joulebook) {
    platform_.joulebook =
        std::make_shared<SXReportingCountingJoulebook>(platform_.joulebook, counters_);
  }
}

SXLogScope SXReportingLogScope(std::string_view shortName, std::string category) {
  SXLogScope scope;
  scope.enabled = true;
  scope.code = SXLogScopeCode(shortName);
  scope.shortName = std::string(shortName);
  scope.subsystem = "com.vendra.sonex";
  scope.category = std::move(category);
  scope.options = 31;
  return scope;
}

void SXReportingEnvironment::registerSessionLogScopeOnce() {
  std::call_once(sessionScopeOnce_, [this] {
    sessionScope_.store(
        keep(log().registerScope(SXReportingLogScope("sxrr", "reporting_session_verbose"))));
  });
}

bool SXReportingEnvironment::isInternalBuild() {
  std::call_once(internalBuildOnce_, [this] {
    auto answer = platform_.device ? platform_.device->property("InternalBuild") : std::nullopt;
    internalBuild_ = answer && answer->is_boolean() && answer->get<bool>();
  });
  return internalBuild_;
}
