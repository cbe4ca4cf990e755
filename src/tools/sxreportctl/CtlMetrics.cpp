#include "CtlMetrics.h"

#include <iostream>

#include "client/SXCtlMetrics.h"

int SXCtlRunMetrics(const SXCtlRequest& request, SXReportingClient& client) {
  SXCallResult<SXValue> result = client.status(SXCtlTimeout(request)).get();
  switch (result.status) {
    case SXCallStatus::kReplied:
      std::cout << SXCtlMetricsText(result.value) << std::flush;
      break;
    case SXCallStatus::kTimedOut:
      std::cerr << "status: the service sent " << result.error << "\n";  // "no reply within 5 s"
      break;
    case SXCallStatus::kRemoteError:
      std::cerr << "status: the service rejected the request: " << result.error << "\n";
      break;
    case SXCallStatus::kConnectionLost:
    case SXCallStatus::kBadReply:
      std::cerr << "status: " << result.error << "\n";
      break;
  }
  return SXCtlExitFor(result.status);
}
