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

#include "Statistics/SXReportingEnvironment.h"
#include "Statistics/SXReportingEventSession.h"
#include "Statistics/SXReportingTallyvaneBridge.h"
#include "common/SXPackedValue.h"
#include "common/SXThreadSafety.h"
#include "common/SXValueText.h"
#include "platform/FernReporting.h"

// A message's payload as a session's aggregate and its send task share it. The caller's
// payload is never changed; the text of its key rewrite is made once, by whichever needs it
// first: normally the send task on the session's queue, so that the server queue only hands
// the payload on. Once the text exists the packed payload is let go (and with it the client's
// charge), so that a started session's aggregate holds only text until stop. Any thread.
class SXReportingMessagePayload final {
 public:
  explicit SXReportingMessagePayload(std::shared_ptr<const SXPackedValue> callerPayload)
      : caller_(std::move(callerPayload)) {}
  // The payload with every space in its keys replaced by "_".
  SXValue rewritten();
  // SXValueText of the rewritten payload (compact JSON), made now if need be; the packed
  // payload is let go.
  std::shared_ptr<const std::string> text();
  void keepOnlyText() { text(); }

 private:
  SXMutex mutex_;
  std::shared_ptr<const SXPackedValue> caller_ SX_GUARDED_BY(mutex_);  // let go with the text
  std::shared_ptr<const std::string> text_ SX_GUARDED_BY(mutex_);
};

// One entry of a session's aggregate: a message entry ({message id: rewritten payload}) or
// any other dictionary (an orientation report, the configuration at the head).
class SXReportingAggregateEntry {
 public:
  SXReportingAggregateEntry(std::string messageId,
                            std::shared_ptr<SXReportingMessagePayload> payload)
      : messageId_(std::move(messageId)), payload_(std::move(payload)) {}
  explicit SXReportingAggregateEntry(SXValue dictionary)
      : dictionary_(std::make_shared<const SXValue>(std::move(dictionary))) {}

  // Calls `visit(key, text of the value)` for each of the entry's keys, in key order.
  template <typename Visit>
  void forEachText(Visit&& visit) const;
  // The entry as a dictionary.
  SXValue toValue() const;

 private:
  std::string messageId_;                               // message entries
  std::shared_ptr<SXReportingMessagePayload> payload_;  // message entries
  std::shared_ptr<const SXValue> dictionary_;           // every other entry
};

template <typename Visit>
void SXReportingAggregateEntry::forEachText(Visit&& visit) const {
  if (!dictionary_) {
    visit(messageId_, *payload_->text());
    return;
  }
  for (const auto& [key, value] : dictionary_->items()) visit(key, SXValueText(value));
}

// A session's aggregate. Its size in bytes is what its message entries are estimated to hold,
// counted as they are appended, and it is part of the service-wide count of aggregate bytes for
// as long as it lives.
struct SXReportingAggregate {
  explicit SXReportingAggregate(SXReportingCounters* counters = nullptr) : counters(counters) {}
  ~SXReportingAggregate() {
    if (counters) counters->aggregateBytesRemoved(bytes.load());
  }
  SXReportingAggregate(const SXReportingAggregate&) = delete;
  SXReportingAggregate& operator=(const SXReportingAggregate&) = delete;
  void addBytes(uint64_t n) {
    bytes.fetch_add(n);
    if (counters) counters->aggregateBytesAdded(n);
  }

  SXRecursiveMutex mutex;
  std::vector<SXReportingAggregateEntry> entries SX_GUARDED_BY(mutex);
  uint64_t dropped SX_GUARDED_BY(mutex) = 0;
  std::atomic<uint64_t> bytes{0};
  SXReportingCounters* const counters;  // the environment's, which outlives every session
};

using SXReportingSendReply = std::function<void(std::optional<FernError>)>;

// `payload` decoded, holding `packed` (and the client's charge it carries) for as long as the
// dictionary is held: what a standalone send of a packed message keeps until it is stored.
std::shared_ptr<const SXValue> SXReportingDecodedPayload(
    SXValue payload, std::shared_ptr<const SXPackedValue> packed);

// A copy of `payload` in which every space in a key is replaced by "_"; values untouched.
SXValue SXReportingSessionUnderscoreKeys(const SXValue& payload);
// Whether the rewrite would change `payload`.
bool SXReportingSessionHasSpacedKeys(const SXValue& payload);

class SXReportingSession : public std::enable_shared_from_this<SXReportingSession>,
                           public SXReportingEventSession {
 public:
  static constexpr SXReportingServiceType kTestServiceType = 11;
  static constexpr SXReportingCategory kSummaryCategory = 0xFFFFFFFF;
  static constexpr SXReportingMessageType kSummaryType = 0xFFFF;

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
  // `payload` is never changed; the shared form lets the send task read it without a copy.
  // `prepared`: the payload's rewritten form, made once for every session a message goes to
  // (a broadcast, a list of IDs), so that its text is made once and shared by their
  // aggregates; made here when null.
  void sendMessage(std::shared_ptr<const SXPackedValue> payload, SXReportingCategory category,
                   SXReportingMessageType type, bool sync, SXReportingSendReply reply,
                   std::shared_ptr<SXReportingMessagePayload> prepared = nullptr);
  void sendMessage(const SXValue& payload, SXReportingCategory category,
                   SXReportingMessageType type, bool sync, SXReportingSendReply reply) {
    sendMessage(std::make_shared<const SXPackedValue>(SXPackedValue::fromValue(payload)),
                category, type, sync, std::move(reply));
  }
  void sendMessage(std::shared_ptr<const SXPackedValue> payload, SXReportingCategory category,
                   SXReportingMessageType type, SXReportingSendReply reply,
                   std::shared_ptr<SXReportingMessagePayload> prepared = nullptr) {
    sendMessage(std::move(payload), category, type, false, std::move(reply),
                std::move(prepared));
  }
  void sendMessage(const SXValue& payload, SXReportingCategory category,
                   SXReportingMessageType type, SXReportingSendReply reply) {
    sendMessage(payload, category, type, false, std::move(reply));
  }

  std::optional<SXValue> createSummaryEventForSession();
  bool shouldReportOrientation();

  // A server-reporting message without a session of its own. `userInfo` is accepted and not
  // sent: a standalone message carries only the client and service names. A delayed send
  // waits within `budget` when one is given; when the budget is full it is refused (logged
  // and counted).
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
  SXValue hostApplicationName() const override;
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

  // One accepted message, waiting for its send task on the session's queue.
  struct PendingSend {
    std::shared_ptr<SXReportingMessagePayload> payload;
    // As the caller gave it, for the verbose line. Held until this session's store has the
    // message: it carries the message's charge on its connection's budget, and a message
    // delivered to several sessions shares one payload that the first store to finish may
    // reduce to text.
    std::shared_ptr<const SXPackedValue> callerPayload;
    SXReportingCategory category;
    SXReportingMessageType type;
    bool startedSnapshot;
    bool aggregated;  // whether an aggregate keeps an entry of it
  };
  // Messages accepted one after another with no other task of the session's queue between
  // them. They share one task on that queue, so that the server-reporting session can store
  // them together instead of one transaction each; the order of everything on the queue is
  // the order of acceptance, as with one task per message.
  struct SendBatch {
    std::vector<PendingSend> sends;  // under the session's batchMutex_
  };

  void runSetupTask(SXValue userInfo, std::string serviceName, std::shared_ptr<SetupState> setup);
  void awaitBackends(const std::shared_ptr<SetupState>& setup);
  void backendWaitTimedOut(SetupState& setup);
  // Queues the send task of one message, joining the batch still waiting on the queue if any.
  void queueSend(PendingSend send);
  // Queues any other task on the session's queue; messages accepted later go behind it.
  void queueTask(SXTask task);
  void runSendBatch(const std::shared_ptr<SendBatch>& batch);
  // The send task of started messages in a row: all to the server-reporting session at once.
  void sendToServerReporting(const std::vector<PendingSend>& sends);
  // The send task of started messages in a row, after which their aggregate entries keep only
  // text, so that the payloads (and the clients' charges on them) are let go. Empties `sends`.
  void sendStarted(std::vector<PendingSend>& sends);
  void runTeardownTask();
  void registerOrientationCallbacks();
  void unregisterOrientationCallbacks();
  void recordOrientation(const char* mode, const char* nameKey, const char* timeKey,
                         int32_t orientation);
  // Appends the entry `makeEntry()` makes under the aggregate's lock, counting `bytes`, unless
  // the session has no aggregate at that moment or it is full (the entry is then never made).
  // Returns whether it appended.
  template <typename MakeEntry>
  bool appendToAggregate(MakeEntry makeEntry, uint64_t bytes = 0) {
    auto aggregate = aggregate_.load();
    if (!aggregate) return false;
    SXMutexLock lock(aggregate->mutex);
    // Stop may have dropped this array while we waited for its lock.
    if (aggregate_.load() != aggregate || !hasRoom(*aggregate)) return false;
    aggregate->entries.push_back(makeEntry());
    aggregate->addBytes(bytes);
    return true;
  }
  // Whether `aggregate` takes another entry; a refusal is counted (and logged once).
  bool hasRoom(SXReportingAggregate& aggregate) SX_REQUIRES(aggregate.mutex);
  std::shared_ptr<SXReportingAggregate> newAggregate() const {
    return std::make_shared<SXReportingAggregate>(&environment_->counters());
  }
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
  SXMutex batchMutex_;
  std::shared_ptr<SendBatch> openBatch_ SX_GUARDED_BY(batchMutex_);  // its task has not run yet

  mutable SXMutex mutex_;
  std::string serviceName_ SX_GUARDED_BY(mutex_) = "unknown";
  SXValue userInfo_ SX_GUARDED_BY(mutex_) = SXValue::object();
  std::optional<SXValue> driverSnapShot_ SX_GUARDED_BY(mutex_);
  Reply<bool> transactionCompleteBlock_ SX_GUARDED_BY(mutex_);
  std::optional<std::string> orientationCallbackID_ SX_GUARDED_BY(mutex_);
  std::optional<SXDate> startDate_ SX_GUARDED_BY(mutex_);
  std::shared_ptr<FernReportingSession> fernReportingSession_ SX_GUARDED_BY(mutex_);
  std::shared_ptr<FernSecureHierarchyToken> fernReportingAgentToken_ SX_GUARDED_BY(mutex_);
};
