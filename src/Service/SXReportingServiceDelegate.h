// The one object that holds service-wide state: the client list, the master switch, the
// defaults and the driver-statistics utility. It accepts every connection, exports a server
// instance on it and installs the connection's handlers.
//
// Threads: `shouldAcceptNewConnection` runs on the listener's thread; the delegate-protocol
// operations, client registration and the defaults reload run on the server queue.
// `findReportingSessionForID` and the creation of a connection's exported object hold the
// delegate's own lock.
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "SXReportingServerInstance.h"
#include "SXReportingServiceProtocol.h"
#include "Statistics/SXReportingDriverUtility.h"
#include "Statistics/SXReportingEnvironment.h"
#include "common/SXThreadSafety.h"
#include "platform/Ipc.h"

// The defaults dictionary read from the preferences domain "com.vendra.sonex".
SXValue SXReportingDefaults(SXPreferences& preferences);

// Numbers that other parts of the daemon keep and `status:` shows. Each is read on the server
// queue whenever a status is asked for, so it must be cheap and thread-safe; an unset provider
// leaves its key out of the status (requests_backpressure shows 0).
struct SXReportingStatusProviders {
  std::function<uint64_t()> requestsBackpressure{};  // requests held back by a slow reader
  std::function<uint64_t()> tallyvaneWriteErrors{};
  std::function<uint64_t()> joulebookWriteErrors{};
  std::function<uint64_t()> fernReportingWriteErrors{};
  std::function<uint64_t()> spoolBacklog{};   // spooled messages not yet uploaded
  std::function<uint64_t()> partialFrames{};  // connections ended by an unfinished request
  std::function<uint64_t()> inflightBytes{};  // what the connections make the service hold
  // Objects of labelled counters and of gauges, merged into those of the status.
  std::function<SXValue()> retentionCounters{};
  std::function<SXValue()> retentionGauges{};
};

class SXReportingServiceDelegate final
    : public SXReportingServiceDelegateProtocol,
      public SXIpcListenerDelegate,
      public std::enable_shared_from_this<SXReportingServiceDelegate> {
 public:
  static std::shared_ptr<SXReportingServiceDelegate> init(
      std::shared_ptr<SXReportingEnvironment> environment);

  bool shouldAcceptNewConnection(const std::shared_ptr<SXIpcConnection>& connection) override;

  // SXReportingServiceDelegateProtocol
  std::optional<SXValue> getDefaults() override;
  const SXReportingClientList& getAllClients() override { return clients_; }
  bool isReportingEnabled() override { return reportingEnabled_.load(); }
  std::shared_ptr<SXReportingSession> findReportingSessionForID(
      int64_t reporterID, SXReportingErrorLines* errorLines = nullptr) override;
  SXValue getSnapShot() override { return driverUtility_->getSnapShot(); }
  std::optional<SXValue> getDriverStatisticsRelativeToSnapShot(
      const std::optional<SXValue>& snapshot) override {
    return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapshot);
  }
  void removeClient(const std::shared_ptr<SXReportingServerInstance>& client) override;

  // Read-only picture of the service for `status:`. Server queue only.
  SXValue statusSnapshot() const;
  // Any thread; usually once, before the listener resumes.
  void setStatusProviders(SXReportingStatusProviders providers);

  void setReportingEnabled(bool enabled) { reportingEnabled_.store(enabled); }
  const std::shared_ptr<SXReportingEnvironment>& environment() const { return environment_; }

  // Server queue: the client registration queued at acceptance.
  void registerClient(const std::weak_ptr<SXReportingServerInstance>& instance,
                      int32_t processIdentifier);
  // Server queue: a delivered defaults notification.
  void defaultsChanged(int token);

 private:
  explicit SXReportingServiceDelegate(std::shared_ptr<SXReportingEnvironment> environment);
  void listenForDefaultsNotification();
  // Counts a new connection of `pid`, or refuses it (logged and counted) when the process
  // already has as many as allowed; `connectionEnded` gives its place back. Any thread.
  bool admitConnection(int32_t pid);
  void connectionEnded(int32_t pid);
  SXValue countersValue() const;
  SXValue gaugesValue() const;
  SXLogFacility& log() const { return environment_->log(); }
  const SXLogScope* scope() const { return environment_->serviceLogScope(); }

  const std::shared_ptr<SXReportingEnvironment> environment_;
  SXMutex mutex_;  // the delegate's own lock
  std::atomic<bool> reportingEnabled_{true};
  SXReportingClientList clients_;  // server queue only
  std::unique_ptr<SXReportingDriverUtility> driverUtility_;
  mutable SXMutex defaultsMutex_;
  std::optional<SXValue> defaults_ SX_GUARDED_BY(defaultsMutex_);
  SXMutex connectionsMutex_;
  std::map<int32_t, uint64_t> connectionsPerProcess_ SX_GUARDED_BY(connectionsMutex_);
  SXReportingErrorLines refusalLines_ SX_GUARDED_BY(connectionsMutex_);
  mutable SXMutex providersMutex_;
  SXReportingStatusProviders providers_ SX_GUARDED_BY(providersMutex_);
};
