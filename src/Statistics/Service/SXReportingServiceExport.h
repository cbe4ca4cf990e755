// What a connection exports: decodes each request's params, checks their number, types and
// ranges, and calls the server instance. A request that fails the checks gets an error reply
// saying what is wrong and changes nothing.
//
// Threads: `handleRequest` runs on the connection's thread; replies go out from wherever the
// operation answers.
#pragma once

#include <memory>

#include "SXReportingEnvironment.h"
#include "SXReportingServerInstance.h"
#include "platform/Ipc.h"

class SXReportingServiceDelegate;

class SXReportingServiceExport final : public SXIpcExportedObject {
 public:
  SXReportingServiceExport(std::shared_ptr<SXReportingServerInstance> instance,
                           std::weak_ptr<SXReportingServiceDelegate> delegate,
                           std::shared_ptr<SXReportingEnvironment> environment);

  void handleRequest(std::string_view method, SXValue params, SXIpcReplyFn reply) override;

  // Checks a request without running it: an empty string when it is well formed, else why not.
  static std::string validate(std::string_view method, const SXValue& params);

 private:
  void dispatch(std::string_view method, SXValue& params, SXIpcReplyFn reply);

  const std::shared_ptr<SXReportingServerInstance> instance_;
  const std::weak_ptr<SXReportingServiceDelegate> delegate_;
  const std::shared_ptr<SXReportingEnvironment> environment_;
};
