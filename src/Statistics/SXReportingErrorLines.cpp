#include "SXReportingErrorLines.h"

bool SXReportingErrorLines::allow(SXReportingEnvironment& environment) {
  SXDate now = environment.platform().clock->now();
  if (!minuteStart_ || now - *minuteStart_ >= std::chrono::minutes(1)) {
    reportSuppressed(environment);
    minuteStart_ = now;
    written_ = 0;
  }
  if (written_ < perMinute_) {
    ++written_;
    return true;
  }
  ++suppressed_;
  environment.counters().dropped(SXReportingGuardrail::kErrorLines);
  return false;
}

void SXReportingErrorLines::reportSuppressed(SXReportingEnvironment& environment) {
  if (suppressed_ == 0) return;
  SXLOG(environment.log(), environment.serviceLogScope(), SXLogLevel::kError,
        "%@ caused %llu more error lines than the %llu a minute written "
        "(--max-error-lines); they were left out",
        source_, static_cast<unsigned long long>(suppressed_),
        static_cast<unsigned long long>(perMinute_));
  suppressed_ = 0;
}
