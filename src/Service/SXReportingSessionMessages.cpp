// A session's message path: numbering, aggregation, the send task, and standalone messages.
#include "SXReportingSession.h"
#include "Statistics/SXReportingUtility.h"
#include "common/MsgpackValue.h"
#include "common/SXServiceTypes.h"

namespace {

constexpr uint32_t kTraceMessage = 0x21042838;
constexpr SXReportingServiceType kAlarmsServiceType = 4;
constexpr uint32_t kAlarmsMaxDelaySeconds = 60;
// How long a started session's send task waits for more of its sends to gather: the spool
// writes them in one transaction (a commit costs about as much as a hundred rows), and the
// sends were answered when they were queued, so only their stay in memory grows.
constexpr std::chrono::milliseconds kSendGathering{5};

}  // namespace

std::string SXReportingSession::messageIdForCategory(SXReportingCategory category,
                                                     SXReportingMessageType type) {
  const std::string& kind = SXReportingUtilityMessageKind(category, type);
  int64_t count = ++messageTypeCounts_[kind];
  return kind + "_" + std::to_string(count);
}

bool SXReportingSession::hasRoom(SXReportingAggregate& aggregate) {
  const SXReportingLimits& limits = environment_->limits();
  SXReportingCounters& counters = environment_->counters();
  std::optional<SXReportingGuardrail> full;
  if (aggregate.entries.size() >= limits.maxAggregateEntries) {
    full = SXReportingGuardrail::kAggregateEntries;
  } else if (aggregate.bytes.load() >= limits.maxAggregateBytes ||
             counters.aggregateBytes() >= limits.maxAggregateBytesTotal) {
    full = SXReportingGuardrail::kAggregateBytes;
  }
  if (!full) return true;
  counters.dropped(*full);
  // One line per aggregate: a client that floods a session would otherwise flood the log.
  if (aggregate.dropped++ == 0) {
    SXLOG(log(), scope(), SXLogLevel::kError,
          "aggregate of reporter %lli is full (%llu entries and %llu bytes; the service's "
          "aggregates hold %llu bytes): further messages are sent but left out of its summary "
          "(--max-aggregate-entries, --max-aggregate-bytes, --max-aggregate-bytes-total)",
          reporterID(), static_cast<unsigned long long>(aggregate.entries.size()),
          static_cast<unsigned long long>(aggregate.bytes.load()),
          static_cast<unsigned long long>(counters.aggregateBytes()));
  }
  return false;
}

void SXReportingSession::sendMessage(std::shared_ptr<const SXPackedValue> payload,
                                     SXReportingCategory category, SXReportingMessageType type,
                                     bool /*sync*/, SXReportingSendReply reply,
                                     std::shared_ptr<SXReportingMessagePayload> prepared) {
  SXLOG(log(), scope(), SXLogLevel::kDebug, "sending message for session owned by %lli",
        reporterID());
  // The key rewrite is made once, where it is first needed (normally by the send task).
  auto rewritten =
      prepared ? std::move(prepared) : std::make_shared<SXReportingMessagePayload>(payload);
  bool aggregated = false;
  if (aggregate_.load()) {
    // What the entry will hold: the payload's text (about one and a half times its
    // MessagePack size) and its id, holder and slot beside it.
    uint64_t bytes = uint64_t{payload->size()} * 3 / 2 + 256;
    aggregated = appendToAggregate(
        [&] { return SXReportingAggregateEntry(messageIdForCategory(category, type), rewritten); },
        bytes);
  }
  // A message left out of the aggregate is numbered all the same; its id is not needed.
  if (!aggregated) ++messageTypeCounts_[SXReportingUtilityMessageKind(category, type)];
  environment_->tracer().trace(kTraceMessage);
  bool startedSnapshot = started();
  queueSend(
      {std::move(rewritten), std::move(payload), category, type, startedSnapshot, aggregated});
  if (reply) reply(std::nullopt);
}

void SXReportingSession::queueSend(PendingSend send) {
  std::shared_ptr<SendBatch> fresh;
  const bool started = send.startedSnapshot;
  {
    SXMutexLock lock(batchMutex_);
    if (!openBatch_) openBatch_ = fresh = std::make_shared<SendBatch>();
    openBatch_->sends.push_back(std::move(send));
  }
  if (!fresh) return;
  // Queued outside the lock: a queue may run the task before async() returns. A standalone
  // send is a transaction of its own anyway: waiting would only hold its bytes longer.
  SXTask task = [self = shared_from_this(), fresh] { self->runSendBatch(fresh); };
  if (started) {
    environment_->platform().dispatch->after(kSendGathering, fernReportingQueue_, std::move(task));
  } else {
    fernReportingQueue_->async(std::move(task));
  }
}

void SXReportingSession::queueTask(SXTask task) {
  std::shared_ptr<SendBatch> open;
  {
    SXMutexLock lock(batchMutex_);
    open = std::exchange(openBatch_, nullptr);  // later sends start a new batch
  }
  // The open batch goes ahead of the task; its own run, later, finds it empty.
  if (open) {
    fernReportingQueue_->async([self = shared_from_this(), open] { self->runSendBatch(open); });
  }
  fernReportingQueue_->async(std::move(task));
}

void SXReportingSession::runSendBatch(const std::shared_ptr<SendBatch>& batch) {
  std::vector<PendingSend> sends;
  {
    SXMutexLock lock(batchMutex_);
    sends.swap(batch->sends);
    if (openBatch_ == batch) openBatch_ = nullptr;
  }
  // Each message in acceptance order; started ones in a row go to the server-reporting
  // session together.
  std::vector<PendingSend> started;
  for (PendingSend& send : sends) {
    if (send.startedSnapshot) {
      started.push_back(std::move(send));
      continue;
    }
    sendStarted(started);
    SXLOG(log(), scope(), SXLogLevel::kDebug, "session not started, will send as a single message");
    // The session's configuration is not part of a standalone message, so none is copied.
    sendSingleMessage(environment_,
                      SXReportingDecodedPayload(send.payload->rewritten(), send.callerPayload),
                      send.category, send.type, serviceType(), nullptr, nullptr,
                      standaloneBudget_);
    if (send.aggregated) send.payload->keepOnlyText();
  }
  sendStarted(started);
}

void SXReportingSession::sendStarted(std::vector<PendingSend>& sends) {
  sendToServerReporting(sends);
  for (const PendingSend& send : sends) {
    if (send.aggregated) send.payload->keepOnlyText();
  }
  sends.clear();
}

void SXReportingSession::sendToServerReporting(const std::vector<PendingSend>& sends) {
  if (sends.empty()) return;
  if (serviceType() == kTestServiceType) {
    for (size_t i = 0; i < sends.size(); ++i) {
      SXLOG(log(), scope(), SXLogLevel::kInfo, "transactions aren't allowed on this platform");
    }
    return;
  }
  auto fernSession = fernReportingSession();
  if (!fernSession) {
    for (size_t i = 0; i < sends.size(); ++i) {
      SXLOG(log(), scope(), SXLogLevel::kError, "%@", "No valid FernReportingSession");
    }
    return;
  }
  // The service stores text: the one the aggregate keeps, made once for both.
  std::vector<FernMessage> messages;
  messages.reserve(sends.size());
  for (const PendingSend& send : sends) {
    messages.push_back(
        {static_cast<uint16_t>(send.category & 0xFFFF), send.type, nullptr, send.payload->text()});
  }
  std::vector<FernSendOutcome> outcomes = fernSession->sendMessages(messages);
  // The verbose line's arguments cost a description per message; build them only when wanted.
  bool verbose = log().isEnabled(scope(), kSXLogVerboseLevel);
  for (size_t i = 0; i < sends.size(); ++i) {
    if (!outcomes[i].sent) {
      if (outcomes[i].error) {
        SXLOG(log(), scope(), SXLogLevel::kError, "error sending message %@",
              outcomes[i].error->localizedDescription);
      }
      continue;
    }
    environment_->counters().delivered(SXReportingSink::kFernReporting);
    if (!verbose) continue;
    SXLOG(log(), scope(), SXLogLevel::kDebug,
          "FernReportingAgent %@ : message %@ : category %i : type %i", fernSession->description(),
          sends[i].callerPayload ? sends[i].callerPayload->value() : SXValue(),
          static_cast<int32_t>(sends[i].category), sends[i].type);
  }
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
                      {fern::kUserInfoServiceName, SXServiceTypeName(serviceType)}};
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

// A place in `budget` for a send that waits for its delay. False when the budget has no room:
// the send is refused, logged (once per run of refusals) and counted, so that a client cannot
// make the service hold an unbounded backlog of delayed sends.
bool reserveWait(SXReportingEnvironment& environment,
                 const std::shared_ptr<SXReportingPendingBudget>& budget, const SXValue& payload,
                 std::shared_ptr<SXReportingPendingBudget::Slot>& slot) {
  uint64_t bytes = SXPackedSize(payload);
  slot = budget->tryAcquire(bytes);
  if (slot) return true;
  environment.counters().dropped(SXReportingGuardrail::kStandalonePending);
  if (budget->firstRefusal()) {
    SXLOG_IN("sendSingleMessage", environment.log(), environment.sessionLogScope(),
             SXLogLevel::kError,
             "client %i has %llu bytes of standalone sends waiting for their delay "
             "(--max-pending-standalone-bytes %llu); further ones are refused until they drain",
             budget->owner(), static_cast<unsigned long long>(budget->pending()),
             static_cast<unsigned long long>(budget->capacity()));
  }
  return false;
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
  std::shared_ptr<SXReportingPendingBudget::Slot> slot;
  if (delay > 0 && budget && !reserveWait(*environment, budget, *payload, slot)) return;
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
