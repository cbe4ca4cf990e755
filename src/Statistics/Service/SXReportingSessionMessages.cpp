// A session's message path: numbering, aggregation, the send task, and standalone messages.
#include "SXReportingSession.h"
#include "SXReportingUtility.h"

namespace {

constexpr uint32_t kTraceMessage = 0x21042838;
constexpr SXReportingServiceType kAlarmsServiceType = 4;
constexpr uint32_t kAlarmsMaxDelaySeconds = 60;

}  // namespace

std::string SXReportingSession::messageIdForCategory(SXReportingCategory category,
                                                     SXReportingMessageType type) {
  const std::string& kind = SXReportingUtilityMessageKind(category, type);
  int64_t count = ++messageTypeCounts_[kind];
  return kind + "_" + std::to_string(count);
}

void SXReportingSession::appendToAggregate(std::shared_ptr<const SXValue> entry) {
  auto aggregate = aggregate_.load();
  if (!aggregate) return;
  std::lock_guard lock(aggregate->mutex);
  // Stop may have dropped this array while we waited for its lock.
  if (aggregate_.load() != aggregate) return;
  uint64_t limit = environment_->limits().maxAggregateEntries;
  if (aggregate->entries.size() < limit) {
    aggregate->entries.push_back(std::move(entry));
    return;
  }
  environment_->counters().dropped(SXReportingGuardrail::kAggregateEntries);
  // One line per aggregate: a client that floods a session would otherwise flood the log.
  if (aggregate->dropped++ == 0) {
    SXLOG(log(), scope(), SXLogLevel::kError,
          "aggregate of reporter %lli is full (%llu entries, --max-aggregate-entries); further "
          "entries are sent but not aggregated",
          reporterID(), static_cast<unsigned long long>(limit));
  }
}

void SXReportingSession::sendMessage(const SXValue& payload, SXReportingCategory category,
                                     SXReportingMessageType type, bool /*sync*/,
                                     SXReportingSendReply reply) {
  SXLOG(log(), scope(), SXLogLevel::kDebug, "sending message for session owned by %lli",
        reporterID());
  SXValue rewritten = SXReportingSessionUnderscoreKeys(payload);
  std::string messageId = messageIdForCategory(category, type);
  // The aggregate entry and the send task share one immutable copy of the rewritten payload.
  auto entry = std::make_shared<const SXValue>(SXValue{{messageId, std::move(rewritten)}});
  appendToAggregate(entry);
  environment_->tracer().trace(kTraceMessage);
  bool startedSnapshot = started();
  // The caller's own payload appears only in a verbose line; keep a copy only for that.
  auto callerPayload = log().isEnabled(scope(), kSXLogVerboseLevel)
                           ? std::make_shared<const SXValue>(payload)
                           : nullptr;
  fernReportingQueue_->async([self = shared_from_this(), entry,
                              callerPayload = std::move(callerPayload), category, type,
                              startedSnapshot] {
    self->runSendTask(entry, callerPayload, category, type, startedSnapshot);
  });
  if (reply) reply(std::nullopt);
}

void SXReportingSession::runSendTask(const std::shared_ptr<const SXValue>& entry,
                                     const std::shared_ptr<const SXValue>& callerPayload,
                                     SXReportingCategory category, SXReportingMessageType type,
                                     bool startedSnapshot) {
  const SXValue& rewritten = entry->begin().value();
  if (!startedSnapshot) {
    SXLOG(log(), scope(), SXLogLevel::kDebug, "session not started, will send as a single message");
    // Shares the aggregate entry's payload instead of copying it.
    std::shared_ptr<const SXValue> payload(entry, &rewritten);
    // The session's configuration is not part of a standalone message, so none is copied.
    sendSingleMessage(environment_, std::move(payload), category, type, serviceType(), nullptr,
                      nullptr, standaloneBudget_);
    return;
  }
  if (serviceType() == kTestServiceType) {
    SXLOG(log(), scope(), SXLogLevel::kInfo, "transactions aren't allowed on this platform");
    return;
  }
  auto fernSession = fernReportingSession();
  if (!fernSession) {
    SXLOG(log(), scope(), SXLogLevel::kError, "%@", "No valid FernReportingSession");
    return;
  }
  std::optional<FernError> error;
  bool sent =
      fernSession->sendMessage(static_cast<uint16_t>(category & 0xFFFF), type, rewritten, error);
  if (!sent) {
    if (error) {
      SXLOG(log(), scope(), SXLogLevel::kError, "error sending message %@",
            error->localizedDescription);
    }
    return;
  }
  environment_->counters().delivered(SXReportingSink::kFernReporting);
  SXLOG(log(), scope(), SXLogLevel::kDebug,
        "FernReportingAgent %@ : message %@ : category %i : type %i", fernSession->description(),
        callerPayload ? *callerPayload : SXValue(), static_cast<int32_t>(category), type);
}

namespace {

// The standalone send task: one message to the server-reporting service with its own session
// info and user info.
void runStandaloneSend(const std::shared_ptr<SXReportingEnvironment>& environment,
                       const std::shared_ptr<const SXValue>& payload, SXReportingCategory category,
                       SXReportingMessageType type, SXReportingServiceType serviceType,
                       const SXReportingSendReply& reply) {
  constexpr const char* fn = "sendSingleMessage";
  auto& log = environment->log();
  auto* scope = environment->sessionLogScope();
  environment->tracer().trace(kTraceMessage);
  SXLOG_IN(fn, log, scope, SXLogLevel::kDebug, "sending single message");
  SXValue sessionInfo = {{fern::kSessionInfoClientType, 19},
                         {fern::kSessionInfoClientVersion, static_cast<double>(1.0f)},
                         {fern::kSessionInfoSessionID, int32_t{-1}}};
  SXValue userInfo = {{fern::kUserInfoClientName, "com.vendra.sonex"},
                      {fern::kUserInfoServiceName, SXReportingUtilityServiceTypeName(serviceType)}};
  // A payload the session already rewrote needs no second copy.
  auto rewritten = SXReportingSessionHasSpacedKeys(*payload)
                       ? std::make_shared<const SXValue>(SXReportingSessionUnderscoreKeys(*payload))
                       : payload;
  std::optional<FernError> error;
  bool sent = environment->platform().fernReporting->sendOneMessage(
      sessionInfo, userInfo, static_cast<uint16_t>(category & 0xFFFF), type, *rewritten, error);
  if (!sent && error) {
    SXLOG_IN(fn, log, scope, SXLogLevel::kError, "sendOneMessageWithSessionInfo %@",
             error->localizedDescription);
  } else if (sent) {
    environment->counters().delivered(SXReportingSink::kFernReporting);
    SXLOG_IN(fn, log, scope, SXLogLevel::kDebug, "message %@ : category %i : type %i", *payload,
             static_cast<int32_t>(category), type);
  }
  if (reply) reply(error);
}

// A place in `budget` for a send that waits `delay` seconds, or nothing when it need not wait
// or has no budget. A full budget cancels the wait: the send goes out at once rather than being
// dropped, and the overflow is logged and counted.
std::shared_ptr<SXReportingPendingBudget::Slot> reserveWait(
    SXReportingEnvironment& environment, const std::shared_ptr<SXReportingPendingBudget>& budget,
    uint32_t& delay) {
  if (delay == 0 || !budget) return nullptr;
  if (auto slot = budget->tryAcquire()) return slot;
  delay = 0;
  environment.counters().dropped(SXReportingGuardrail::kStandalonePending);
  if (budget->firstRefusal()) {
    SXLOG_IN("sendSingleMessage", environment.log(), environment.sessionLogScope(),
             SXLogLevel::kError,
             "client %i has %llu standalone sends waiting for their delay "
             "(--max-pending-standalone); sending further ones at once",
             budget->owner(), static_cast<unsigned long long>(budget->capacity()));
  }
  return nullptr;
}

}  // namespace

void SXReportingSession::sendSingleMessage(
    const std::shared_ptr<SXReportingEnvironment>& environment,
    std::shared_ptr<const SXValue> payload, SXReportingCategory category,
    SXReportingMessageType type, SXReportingServiceType serviceType,
    const SXValue* /*userInfo: not sent*/, SXReportingSendReply reply,
    const std::shared_ptr<SXReportingPendingBudget>& budget) {
  const SXPlatform& platform = environment->platform();
  uint32_t delay =
      serviceType == kAlarmsServiceType ? platform.random->uniform(kAlarmsMaxDelaySeconds) : 0;
  auto slot = reserveWait(*environment, budget, delay);
  SXLOG(environment->log(), environment->sessionLogScope(), SXLogLevel::kDebug,
        "sending single message after delta %lli for service %i", static_cast<int64_t>(delay),
        serviceType);
  auto task = [environment, payload = std::move(payload), category, type, serviceType,
               reply = std::move(reply), slot = std::move(slot)] {
    (void)slot;  // the place in the budget is held until the send has run
    runStandaloneSend(environment, payload, category, type, serviceType, reply);
  };
  platform.dispatch->after(std::chrono::seconds(delay),
                           platform.dispatch->lowPriorityConcurrentQueue(), std::move(task));
}
