// The service's two interfaces: the operations a client calls over its connection, and the
// in-process operations a server instance calls on the service delegate.
#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "common/SXPackedValue.h"
#include "sxreporting/types.h"

class SXReportingServerInstance;
class SXReportingSession;
class SXReportingErrorLines;

// The client protocol. Every operation is asynchronous and answers through its reply, which
// some outcomes never call (reporter ID 0 for several operations, a repeated start,
// killService).
class SXReportingServiceProtocol {
 public:
  virtual ~SXReportingServiceProtocol() = default;
  virtual void createReportingSession(int64_t reporterID, Reply<bool> reply) = 0;
  virtual void setServiceType(SXReportingServiceType serviceType, int64_t reporterID,
                              Reply<bool> reply) = 0;
  virtual void getServiceNameForReporterID(int64_t reporterID,
                                           Reply<SXReportingServiceType> reply) = 0;
  virtual void setConfiguration(std::optional<SXValue> configuration, int64_t reporterID,
                                Reply<bool> reply) = 0;
  virtual void startReportingSessionForID(int64_t reporterID, Reply<bool> reply) = 0;
  // The message is shared, never changed: every sink and session reads this one copy.
  virtual void sendMessage(std::shared_ptr<const SXPackedValue> message,
                           SXReportingCategory category,
                           SXReportingMessageType type,
                           std::optional<std::vector<int64_t>> reporterIDs,
                           Reply<std::optional<SXError>> reply) = 0;
  virtual void stopReportingSessionForID(int64_t reporterID, Reply<bool> reply) = 0;
  virtual void destroyReportingSession(int64_t reporterID, Reply<bool> reply) = 0;
  virtual void reporterID(int64_t reporterID, Reply<SXValue> valid) = 0;
  virtual void getAllReporters(Reply<std::vector<int64_t>> reply) = 0;
  virtual void killService(Reply<bool> reply) = 0;
};

using SXReportingClientList = std::vector<std::shared_ptr<SXReportingServerInstance>>;

// Called by server instances on the server queue.
class SXReportingServiceDelegateProtocol {
 public:
  virtual ~SXReportingServiceDelegateProtocol() = default;
  virtual std::optional<SXValue> getDefaults() = 0;
  // The live list, not a copy.
  virtual const SXReportingClientList& getAllClients() = 0;
  virtual bool isReportingEnabled() = 0;
  // A failed lookup's error line counts against `errorLines` when given.
  virtual std::shared_ptr<SXReportingSession> findReportingSessionForID(
      int64_t reporterID, SXReportingErrorLines* errorLines = nullptr) = 0;
  virtual SXValue getSnapShot() = 0;
  virtual std::optional<SXValue> getDriverStatisticsRelativeToSnapShot(
      const std::optional<SXValue>& snapshot) = 0;
  virtual void removeClient(const std::shared_ptr<SXReportingServerInstance>& client) = 0;
};
