// One reporting session: identity, service type and configuration, message numbering and the
// aggregate gathered since start, its server-reporting session on a private serial queue,
// orientation tracking and the summary it condenses at stop.
//
// Threads: every operation is called on the server queue, except the accessors, which any
// thread may call. Server-reporting work runs on the session's own serial queue; orientation
// callbacks arrive on threads of the orientation service.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "SXReportingEnvironment.h"
#include "platform/FernReporting.h"

// The payloads gathered since start. Every change of `entries` and every walk over it holds
// `mutex`, the recursive lock keyed on the array itself. Entries never change once appended,
// so a walk may copy the pointers and read them after unlocking.
// Holds at most the environment's maxAggregateEntries; what did not fit is only counted.
struct SXReportingAggregate {
  std::recursive_mutex mutex;
  std::vector<std::shared_ptr<const SXValue>> entries;  // GUARDED_BY(mutex)
  uint64_t dropped = 0;                                 // GUARDED_BY(mutex)
};

using SXReportingSendReply = std::function<void(std::optional<FernError>)>;

// A copy of `payload` in which every space in a key is replaced by "_"; values untouched.
SXValue SXReportingSessionUnderscoreKeys(const SXValue& payload);
// Whether the rewrite would change `payload`.
bool SXReportingSessionHasSpacedKeys(const SXValue& payload);

class SXReportingSession : public std::enable_shared_from_this<SXReportingSession> {
 public:
  static constexpr SXReportingServiceType kTestServiceType = 11;
  static constexpr SXReportingCategory kSummaryCategory = 0xFFFFFFFF;
  static constexpr SXReportingMessageType kSummaryType = 0xFFFF;
  // The summary event's count of entries the aggregate had no room for; present only then.
  static constexpr const char* kDroppedEntriesKey = "SX_Session_Entries_Dropped";

  // Creation. Never fails on this platform; callers still test for none. `standaloneBudget`
  // is the owning client's: the session's delayed standalone sends wait within it.
  static std::shared_ptr<SXReportingSession> initWithID(
      std::shared_ptr<SXReportingEnvironment> environment, int64_t reporterID,
      SXValue processIdentifiers,
      std::shared_ptr<SXReportingPendingBudget> standaloneBudget = nullptr);
  ~SXReportingSession();
  SXReportingSession(const SXReportingSession&) = delete;
  SXReportingSession& operator=(const SXReportingSession&) = delete;

  void setServiceType(SXReportingServiceType serviceType);
  void setConfiguration(const SXValue* configuration);
  void updateDefaults(const SXValue* defaults);

  void start();
  void stop();

  std::string messageIdForCategory(SXReportingCategory category, SXReportingMessageType type);
  void sendMessage(const SXValue& payload, SXReportingCategory category,
                   SXReportingMessageType type, bool sync, SXReportingSendReply reply);
  void sendMessage(const SXValue& payload, SXReportingCategory category,
                   SXReportingMessageType type, SXReportingSendReply reply) {
    sendMessage(payload, category, type, false, std::move(reply));
  }

  std::optional<SXValue> createSummaryEventForSession();
  bool shouldReportOrientation();

  // A server-reporting message without a session of its own. `userInfo` is accepted and not
  // sent: a standalone message carries only the client and service names. A delayed send
  // waits within `budget` when one is given; when the budget is full it goes out at once.
  static void sendSingleMessage(const std::shared_ptr<SXReportingEnvironment>& environment,
                                std::shared_ptr<const SXValue> payload,
                                SXReportingCategory category, SXReportingMessageType type,
                                SXReportingServiceType serviceType, const SXValue* userInfo,
                                SXReportingSendReply reply,
                                const std::shared_ptr<SXReportingPendingBudget>& budget = nullptr);
  static void sendSingleMessage(const std::shared_ptr<SXReportingEnvironment>& environment,
                                const SXValue& payload, SXReportingCategory category,
                                SXReportingMessageType type, SXReportingServiceType serviceType,
                                const SXValue* userInfo, SXReportingSendReply reply) {
    sendSingleMessage(environment, std::make_shared<const SXValue>(payload), category, type,
                      serviceType, userInfo, std::move(reply));
  }

  // Accessors (any thread).
  int64_t reporterID() const { return reporterID_.load(); }
  bool started() const { return started_.load(); }
  void setStarted(bool started) { started_.store(started); }
  bool fernReportingSessionStarted() const { return fernReportingSessionStarted_.load(); }
  SXReportingServiceType serviceType() const { return serviceType_.load(); }
  std::string serviceName() const;
  SXValue userInfo() const;
  // The configuration's host application name ("Unknown" when unset), without copying the
  // whole configuration: the bridges ask for it on every delivered message.
  SXValue hostApplicationName() const;
  std::optional<SXValue> driverSnapShot() const;
  void setDriverSnapShot(std::optional<SXValue> snapshot);
  void setTransactionCompleteBlock(Reply<bool> block);
  const SXValue& processIdentifiers() const { return processIdentifiers_; }
  std::shared_ptr<SXReportingAggregate> aggregatedPayloadData() const { return aggregate_.load(); }
  // A copy of the aggregate's entries (empty when there is none).
  std::vector<SXValue> aggregatedPayloadEntries() const;
  std::map<std::string, int64_t> messageTypeCounts() const { return messageTypeCounts_; }
  std::optional<std::string> orientationCallbackID() const;
  std::optional<SXDate> startDate() const;
  std::shared_ptr<FernReportingSession> fernReportingSession() const;
  std::shared_ptr<FernSecureHierarchyToken> fernReportingAgentToken() const;
  const std::shared_ptr<SXWorkQueue>& fernReportingQueue() const { return fernReportingQueue_; }
  // One-line description for log lines.
  std::string description() const;

 private:
  struct SetupState;

  SXReportingSession(std::shared_ptr<SXReportingEnvironment> environment, int64_t reporterID,
                     SXValue processIdentifiers,
                     std::shared_ptr<SXReportingPendingBudget> standaloneBudget);

  SXLogFacility& log() const { return environment_->log(); }
  const SXLogScope* scope() const { return environment_->sessionLogScope(); }

  void runSetupTask(SXValue userInfo, std::string serviceName, std::shared_ptr<SetupState> setup);
  void runSendTask(const std::shared_ptr<const SXValue>& entry,
                   const std::shared_ptr<const SXValue>& callerPayload,
                   SXReportingCategory category, SXReportingMessageType type, bool startedSnapshot);
  void runTeardownTask();
  void registerOrientationCallbacks();
  void unregisterOrientationCallbacks();
  void recordOrientation(const char* mode, const char* nameKey, const char* timeKey,
                         int32_t orientation);
  // Appends under the aggregate's lock, unless the session has no aggregate at that moment.
  void appendToAggregate(std::shared_ptr<const SXValue> entry);
  void writeSummaryFile(const std::shared_ptr<SXReportingAggregate>& aggregate,
                        const SXValue& userInfo);

  const std::shared_ptr<SXReportingEnvironment> environment_;
  std::atomic<int64_t> reporterID_;
  std::atomic<bool> started_{false};
  std::atomic<bool> fernReportingSessionStarted_{false};
  std::atomic<SXReportingServiceType> serviceType_{kSXReportingServiceTypeUnknown};
  const SXValue processIdentifiers_;
  const std::shared_ptr<SXWorkQueue> fernReportingQueue_;
  const std::shared_ptr<SXReportingPendingBudget> standaloneBudget_;  // may be null
  std::atomic<std::shared_ptr<SXReportingAggregate>> aggregate_;
  std::map<std::string, int64_t> messageTypeCounts_;  // server queue only

  mutable std::mutex mutex_;
  std::string serviceName_ = "unknown";                                // GUARDED_BY(mutex_)
  SXValue userInfo_ = SXValue::object();                               // GUARDED_BY(mutex_)
  std::optional<SXValue> driverSnapShot_;                              // GUARDED_BY(mutex_)
  Reply<bool> transactionCompleteBlock_;                               // GUARDED_BY(mutex_)
  std::optional<std::string> orientationCallbackID_;                   // GUARDED_BY(mutex_)
  std::optional<SXDate> startDate_;                                    // GUARDED_BY(mutex_)
  std::shared_ptr<FernReportingSession> fernReportingSession_;         // GUARDED_BY(mutex_)
  std::shared_ptr<FernSecureHierarchyToken> fernReportingAgentToken_;  // GUARDED_BY(mutex_)
};
