// The object exported over one client connection: the client's session registry and its
// handling of every protocol operation.
//
// Threads: protocol operations are called on the connection's thread; each logs its request
// line there and queues its work on the server queue, where the session map is read and
// changed without a lock. The accessors may be called from any thread.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>

#include "SXReportingServiceProtocol.h"
#include "SXReportingSession.h"
#include "Statistics/SXReportingEnvironment.h"
#include "Statistics/SXReportingErrorLines.h"
#include "common/SXThreadSafety.h"
#include "platform/ByteBudget.h"

class SXReportingServerInstance final
    : public SXReportingServiceProtocol,
      public std::enable_shared_from_this<SXReportingServerInstance> {
 public:
  using SessionMap = std::map<int64_t, std::shared_ptr<SXReportingSession>>;

  static std::shared_ptr<SXReportingServerInstance> initWithPID(
      std::shared_ptr<SXReportingEnvironment> environment, int32_t processIdentifier,
      std::weak_ptr<SXReportingServiceDelegateProtocol> delegate,
      std::shared_ptr<SXByteBudget> budget = nullptr);
  ~SXReportingServerInstance() override;

  // SXReportingServiceProtocol
  void createReportingSession(int64_t reporterID, Reply<bool> reply) override;
  void setServiceType(SXReportingServiceType serviceType, int64_t reporterID,
                      Reply<bool> reply) override;
  void getServiceNameForReporterID(int64_t reporterID,
                                   Reply<SXReportingServiceType> reply) override;
  void setConfiguration(std::optional<SXValue> configuration, int64_t reporterID,
                        Reply<bool> reply) override;
  void startReportingSessionForID(int64_t reporterID, Reply<bool> reply) override;
  void sendMessage(std::shared_ptr<const SXPackedValue> message, SXReportingCategory category,
                   SXReportingMessageType type, std::optional<std::vector<int64_t>> reporterIDs,
                   Reply<std::optional<SXError>> reply) override;
  void stopReportingSessionForID(int64_t reporterID, Reply<bool> reply) override;
  void destroyReportingSession(int64_t reporterID, Reply<bool> reply) override;
  void reporterID(int64_t reporterID, Reply<SXValue> valid) override;
  void getAllReporters(Reply<std::vector<int64_t>> reply) override;
  void killService(Reply<bool> reply) override;

  // Queues the connection-error work: stop started sessions, leave the client list.
  void handleConnectionError();

  // Own map first, then the service-wide lookup. Server queue only.
  std::shared_ptr<SXReportingSession> findReportingSessionForID(int64_t reporterID);
  // Server queue only.
  const SessionMap& clientReportingSessionMap() const { return sessions_; }

  int32_t processIdentifier() const { return processIdentifier_; }
  std::optional<SXDate> clientStartDate() const;
  void setClientStartDate(std::optional<SXDate> date);
  std::optional<std::string> clientProcessName() const;
  void setClientProcessName(std::optional<std::string> name);

 private:
  SXReportingServerInstance(std::shared_ptr<SXReportingEnvironment> environment,
                            int32_t processIdentifier,
                            std::weak_ptr<SXReportingServiceDelegateProtocol> delegate,
                            std::shared_ptr<SXByteBudget> budget);

  SXLogFacility& log() const { return environment_->log(); }
  const SXLogScope* scope() const { return environment_->serviceLogScope(); }
  // Runs `work(*this)` on the server queue, holding this instance until it has run. A
  // template, so that a request's work is wrapped once, not twice.
  template <typename Work>
  void enqueue(Work work) {
    environment_->serverQueue()->async(
        [self = shared_from_this(), work = std::move(work)]() mutable { work(*self); });
  }
  std::shared_ptr<SXReportingSession> ownSession(int64_t reporterID) const;
  // Whether the session limits leave room for a new session under `reporterID` (replacing
  // one always does); logs and counts a refusal as the function `fn`.
  bool hasRoomForSession(int64_t reporterID, const char* fn);
  void routeAddressed(std::shared_ptr<const SXPackedValue> message, SXReportingCategory category,
                      SXReportingMessageType type, const std::vector<int64_t>& reporterIDs);
  // The message, charged with what its deliveries beyond the first make the service hold
  // (each session's copy of its text, its queue entry, its aggregate entry, its analytics row).
  std::shared_ptr<const SXPackedValue> chargeDeliveries(
      std::shared_ptr<const SXPackedValue> message, size_t deliveries) const;
  void routeBroadcast(const std::shared_ptr<const SXPackedValue>& message,
                      SXReportingCategory category, SXReportingMessageType type);
  void sendDriverDeltaAndStop(const std::shared_ptr<SXReportingSession>& session);

  const std::shared_ptr<SXReportingEnvironment> environment_;
  const int32_t processIdentifier_;
  const std::weak_ptr<SXReportingServiceDelegateProtocol> delegate_;
  const std::shared_ptr<SXByteBudget> budget_;  // the connection's; may be null
  SessionMap sessions_;  // server queue only; its size is counted in the environment's gauge
  // Standalone sends of this client's sessions waiting for their delay.
  const std::shared_ptr<SXReportingPendingBudget> standaloneBudget_;
  SXReportingErrorLines errorLines_;  // server queue only
  mutable SXMutex mutex_;
  std::optional<SXDate> clientStartDate_ SX_GUARDED_BY(mutex_);
  std::optional<std::string> clientProcessName_ SX_GUARDED_BY(mutex_);
};
