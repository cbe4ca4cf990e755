// What a connection exports: decodes each request's params, checks their number, types,
// ranges and sizes, and calls the server instance. A request that fails the checks gets an
// error reply saying what is wrong and changes nothing. A message's payload carries a charge
// of the connection's byte budget for as long as any store or queue holds it.
//
// Threads: `handleRequest` runs on the connection's thread; replies go out from wherever the
// operation answers.
#pragma once

#include <memory>
#include <optional>

#include "SXReportingServerInstance.h"
#include "Statistics/SXReportingEnvironment.h"
#include "common/SXPackedValue.h"
#include "platform/Ipc.h"

class SXReportingServiceDelegate;

class SXReportingServiceExport final : public SXIpcExportedObject {
 public:
  SXReportingServiceExport(std::shared_ptr<SXReportingServerInstance> instance,
                           std::weak_ptr<SXReportingServiceDelegate> delegate,
                           std::shared_ptr<SXReportingEnvironment> environment,
                           std::shared_ptr<SXByteBudget> budget = nullptr);

  void handleRequest(std::string_view method, SXValue params, size_t wireBytes,
                     SXIpcReplyFn reply) override;
  // A send's params are read from their bytes without decoding them, and its payload stays
  // packed: the stores write their texts straight from its bytes.
  bool handlePackedRequest(std::string_view method, std::string_view params, size_t wireBytes,
                           SXIpcReplyFn& reply) override;

  // Checks a request without running it: an empty string when it is well formed, else why not.
  static std::string validate(std::string_view method, const SXValue& params);

 private:
  // A send's params, read and checked.
  struct Send {
    SXPackedValue payload;
    SXReportingCategory category;
    SXReportingMessageType type;
    std::optional<std::vector<int64_t>> reporterIDs;
  };
  // A send's params read straight from their bytes; nothing when one of them is not what it
  // must be (the decoded path then says what is wrong).
  static std::optional<Send> readSend(std::string_view params);
  // Empty when the request is within the size limits, else why not (and counted).
  std::string checkLimits(std::string_view method, const SXValue& params, size_t wireBytes);
  std::string checkSendLimits(const Send& send, size_t wireBytes);
  void dispatch(std::string_view method, SXValue& params, SXIpcReplyFn reply);
  void dispatchSend(Send send, size_t wireBytes, SXIpcReplyFn reply);

  const std::shared_ptr<SXReportingServerInstance> instance_;
  const std::weak_ptr<SXReportingServiceDelegate> delegate_;
  const std::shared_ptr<SXReportingEnvironment> environment_;
  const std::shared_ptr<SXByteBudget> budget_;  // may be null
};

// Removes repeated reporter IDs, keeping each one's first place: a message reaches a session
// once however often a list names it.
void SXReportingRemoveRepeatedIDs(std::vector<int64_t>& reporterIDs);
