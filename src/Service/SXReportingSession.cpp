// Session record, configuration, start and stop.
#include "SXReportingSession.h"

#include <algorithm>

#include "Statistics/SXReportingUtility.h"
#include "common/SXServiceTypes.h"
#include "common/SXThreadSafety.h"

namespace {

constexpr uint32_t kTraceCreated = 0x21042828;
constexpr uint32_t kTraceStarted = 0x2104282C;
constexpr uint32_t kTraceStopped = 0x21042830;
constexpr uint32_t kTraceDestroyed = 0x21042834;

constexpr const char* kWaitingForBackends = "waiting for fernreportingd to find backends";
constexpr const char* kNoBackendFound = "failed to find backend";
// The wait's lines carry the name of the bounded wait they have always come from.
constexpr const char* kWaitFunction = "SXReportingUtilityWait";

void mergeInto(SXValue& target, const SXValue* source) {
  if (!source || !source->is_object()) return;
  for (const auto& [key, value] : source->items()) target[key] = value;
}

}  // namespace

// What the setup task, the configuration completion and the wait's timer share. Any of them
// may outlive the others.
struct SXReportingSession::SetupState {
  explicit SetupState(bool found) : backendsFound(found) {}

  SXMutex mutex;
  bool backendsFound SX_GUARDED_BY(mutex);
  // The session's queue is suspended until the backends come or the wait times out.
  bool waiting SX_GUARDED_BY(mutex) = false;
};

bool SXReportingSessionHasSpacedKeys(const SXValue& payload) {
  if (!payload.is_object()) return true;  // the rewrite turns it into a dictionary
  for (const auto& [key, value] : payload.items()) {
    if (key.find(' ') != std::string::npos) return true;
  }
  return false;
}

namespace {

std::string underscored(std::string_view key) {
  std::string name(key);
  std::replace(name.begin(), name.end(), ' ', '_');
  return name;
}

}  // namespace

std::shared_ptr<const SXValue> SXReportingDecodedPayload(
    SXValue payload, std::shared_ptr<const SXPackedValue> packed) {
  struct Holder {
    SXValue payload;
    std::shared_ptr<const SXPackedValue> packed;
  };
  auto holder = std::make_shared<const Holder>(Holder{std::move(payload), std::move(packed)});
  return std::shared_ptr<const SXValue>(holder, &holder->payload);
}

SXValue SXReportingSessionUnderscoreKeys(const SXValue& payload) {
  SXValue rewritten = SXValue::object();
  if (!payload.is_object()) return rewritten;
  // In key order, so that of keys that become equal the last in that order stays.
  for (auto it = payload.cbegin(); it != payload.cend(); ++it) {
    rewritten[underscored(it.key())] = it.value();
  }
  return rewritten;
}

SXValue SXReportingMessagePayload::rewritten() {
  SXMutexLock lock(mutex_);
  // Asked for after the packed payload was let go: the text is a dump, so it parses.
  if (!caller_) return SXValue::parse(*text_);
  return SXReportingSessionUnderscoreKeys(caller_->value());
}

std::shared_ptr<const std::string> SXReportingMessagePayload::text() {
  SXMutexLock lock(mutex_);
  if (!text_) text_ = std::make_shared<const std::string>(SXPackedDictionaryText(*caller_, true));
  caller_ = nullptr;
  return text_;
}

SXValue SXReportingAggregateEntry::toValue() const {
  if (dictionary_) return *dictionary_;
  return SXValue{{messageId_, payload_->rewritten()}};
}

std::shared_ptr<SXReportingSession> SXReportingSession::initWithID(
    std::shared_ptr<SXReportingEnvironment> environment, int64_t reporterID,
    SXValue processIdentifiers, std::shared_ptr<SXReportingPendingBudget> standaloneBudget) {
  environment->registerSessionLogScopeOnce();
  std::shared_ptr<SXReportingSession> session(
      new SXReportingSession(std::move(environment), reporterID, std::move(processIdentifiers),
                             std::move(standaloneBudget)));
  SXLOG(session->log(), session->scope(), SXLogLevel::kInfo,
        "created reporting session for ID: %lli", reporterID);
  session->environment_->tracer().trace(kTraceCreated);
  return session;
}

SXReportingSession::SXReportingSession(std::shared_ptr<SXReportingEnvironment> environment,
                                       int64_t reporterID, SXValue processIdentifiers,
                                       std::shared_ptr<SXReportingPendingBudget> standaloneBudget)
    : environment_(std::move(environment)),
      reporterID_(reporterID),
      processIdentifiers_(std::move(processIdentifiers)),
      fernReportingQueue_(environment_->platform().dispatch->createSerialQueue(
          "com.vendra.sonex.session.fernreporting", SXQualityOfService::kUtility)),
      standaloneBudget_(std::move(standaloneBudget)),
      aggregate_(newAggregate()) {}

SXReportingSession::~SXReportingSession() {
  environment_->tracer().trace(kTraceDestroyed);
  SXLOG(log(), scope(), SXLogLevel::kInfo, "deallocing this session %lli", reporterID());
}

void SXReportingSession::setServiceType(SXReportingServiceType serviceType) {
  serviceType_.store(serviceType);
  std::string name = SXServiceTypeName(serviceType);
  {
    SXMutexLock lock(mutex_);
    serviceName_ = name;
  }
  SXLOG(log(), scope(), SXLogLevel::kInfo, "setting service type %@", name);
}

void SXReportingSession::setConfiguration(const SXValue* configuration) {
  SXMutexLock lock(mutex_);
  mergeInto(userInfo_, configuration);
}

void SXReportingSession::updateDefaults(const SXValue* defaults) {
  SXMutexLock lock(mutex_);
  mergeInto(userInfo_, defaults);
}

void SXReportingSession::start() {
  SXLOG(log(), scope(), SXLogLevel::kDebug, "starting session owned by %lli", reporterID());
  if (started()) {
    SXLOG(log(), scope(), SXLogLevel::kInfo, "%lli is already started", reporterID());
    return;
  }
  setStarted(true);
  aggregate_.store(newAggregate());
  environment_->tracer().trace(kTraceStarted);
  if (shouldReportOrientation()) registerOrientationCallbacks();

  auto setup = std::make_shared<SetupState>(fernReportingSessionStarted());
  queueTask([self = shared_from_this(), userInfo = this->userInfo(), name = serviceName(), setup] {
    self->runSetupTask(userInfo, name, setup);
  });
}

void SXReportingSession::runSetupTask(SXValue userInfo, std::string serviceName,
                                      std::shared_ptr<SetupState> setup) {
  if (serviceType() == kTestServiceType) return;
  FernReporting& fern = *environment_->platform().fernReporting;
  auto token = fern.newHierarchyToken(nullptr);

  SXValue sessionInfo = {
      {fern::kSessionInfoClientType, 19},
      {fern::kSessionInfoClientVersion, static_cast<double>(1.0f)},
      {fern::kSessionInfoSessionID, reporterID()},
      {fern::kSessionInfoBatchEvent, true},
      {fern::kSessionInfoHierarchyToken, token ? SXValue(token->identifier()) : SXValue()}};
  SXValue fernUserInfo = {{fern::kUserInfoClientName, "com.vendra.sonex"},
                          {fern::kUserInfoServiceName, serviceName + "_session"}};
  mergeInto(fernUserInfo, &userInfo);

  auto fernSession = fern.openSession(sessionInfo, fernUserInfo, SXValue::array());
  {
    SXMutexLock lock(mutex_);
    fernReportingAgentToken_ = token;
    fernReportingSession_ = fernSession;
  }
  if (fernSession) {
    fernSession->startConfiguration(
        [fn = __func__, environment = environment_, setup,
         queue = fernReportingQueue_](std::optional<std::vector<std::string>> backends) {
          auto& log = environment->log();
          auto* scope = environment->sessionLogScope();
          if (!backends || backends->empty()) {
            SXLOG_IN(fn, log, scope, SXLogLevel::kError,
                     "No backends found, this session won't get sent to the server");
            return;
          }
          SXLOG_IN(fn, log, scope, SXLogLevel::kDefault, "List of backends %@", SXValue(*backends));
          SXMutexLock lock(setup->mutex);
          setup->backendsFound = true;
          if (!setup->waiting) return;  // not waiting yet, or the wait is over
          setup->waiting = false;
          SXLOG_IN(kWaitFunction, log, scope, SXLogLevel::kDefault, "continuing");
          queue->resume();
        });
  }
  awaitBackends(setup);
}

// The session's queue stays suspended, holding no thread, until the configuration completion
// resumes it or the time-out does, whichever comes first; tasks queued meanwhile run after.
void SXReportingSession::awaitBackends(const std::shared_ptr<SetupState>& setup) {
  {
    SXMutexLock lock(setup->mutex);
    if (setup->backendsFound) return;
    SXLOG_IN(kWaitFunction, log(), scope(), SXLogLevel::kDefault, "%@",
             std::string(kWaitingForBackends));
    setup->waiting = true;
    fernReportingQueue_->suspend();
  }
  const auto timeout = std::chrono::duration_cast<std::chrono::nanoseconds>(
      std::chrono::duration<double>(environment_->backendWaitSeconds()));
  auto& dispatch = *environment_->platform().dispatch;
  dispatch.after(timeout, dispatch.lowPriorityConcurrentQueue(),
                 [self = shared_from_this(), setup] { self->backendWaitTimedOut(*setup); });
}

void SXReportingSession::backendWaitTimedOut(SetupState& setup) {
  {
    SXMutexLock lock(setup.mutex);
    if (!setup.waiting) return;  // the backends came in time
    setup.waiting = false;
    SXLOG_IN(kWaitFunction, log(), scope(), SXLogLevel::kError, "%@", std::string(kNoBackendFound));
  }
  // Backends reported from now on set the flag and change nothing else.
  {
    SXMutexLock lock(mutex_);
    fernReportingSession_ = nullptr;
  }
  fernReportingSessionStarted_.store(false);
  fernReportingQueue_->resume();
}

void SXReportingSession::stop() {
  SXLOG(log(), scope(), SXLogLevel::kDebug, "ending session %lli", reporterID());
  if (shouldReportOrientation() && orientationCallbackID()) unregisterOrientationCallbacks();
  if (!started()) return;
  SXLOG(log(), scope(), SXLogLevel::kDebug, "ending session %lli", reporterID());
  environment_->tracer().trace(kTraceStopped);

  if (auto summary = createSummaryEventForSession()) {
    SXLOG(log(), scope(), SXLogLevel::kDefault, "sending summary event for reporter %lli",
          reporterID());
    sendMessage(*summary, kSummaryCategory, kSummaryType, true, nullptr);
  }
  queueTask([self = shared_from_this()] { self->runTeardownTask(); });
  if (auto aggregate = aggregate_.load()) {
    SXMutexLock lock(aggregate->mutex);
    aggregate_.store(nullptr);
  } else {
    aggregate_.store(nullptr);
  }
  setStarted(false);

  Reply<bool> complete;
  {
    SXMutexLock lock(mutex_);
    complete = std::move(transactionCompleteBlock_);
    transactionCompleteBlock_ = nullptr;
  }
  if (complete) complete(true);
}

void SXReportingSession::runTeardownTask() {
  if (serviceType() == kTestServiceType) return;
  std::shared_ptr<FernReportingSession> fernSession;
  {
    SXMutexLock lock(mutex_);
    fernSession = std::exchange(fernReportingSession_, nullptr);
  }
  if (!fernSession) return;
  fernSession->flushMessages(
      [fn = __func__, environment = environment_](std::optional<FernError> error) {
        if (error) {
          SXLOG_IN(fn, environment->log(), environment->sessionLogScope(), SXLogLevel::kError,
                   "flush error %@", error->localizedDescription);
        }
      });
}

std::string SXReportingSession::serviceName() const {
  SXMutexLock lock(mutex_);
  return serviceName_;
}

SXValue SXReportingSession::userInfo() const {
  SXMutexLock lock(mutex_);
  return userInfo_;
}

SXValue SXReportingSession::hostApplicationName() const {
  SXMutexLock lock(mutex_);
  return SXReportingUtilityHostApplicationName(&userInfo_);
}

std::optional<SXValue> SXReportingSession::driverSnapShot() const {
  SXMutexLock lock(mutex_);
  return driverSnapShot_;
}

void SXReportingSession::setDriverSnapShot(std::optional<SXValue> snapshot) {
  SXMutexLock lock(mutex_);
  driverSnapShot_ = std::move(snapshot);
}

void SXReportingSession::setTransactionCompleteBlock(Reply<bool> block) {
  SXMutexLock lock(mutex_);
  transactionCompleteBlock_ = std::move(block);
}

std::vector<SXValue> SXReportingSession::aggregatedPayloadEntries() const {
  std::vector<SXValue> out;
  auto aggregate = aggregate_.load();
  if (!aggregate) return out;
  SXMutexLock lock(aggregate->mutex);
  for (const auto& entry : aggregate->entries) out.push_back(entry.toValue());
  return out;
}

std::optional<std::string> SXReportingSession::orientationCallbackID() const {
  SXMutexLock lock(mutex_);
  return orientationCallbackID_;
}

std::optional<SXDate> SXReportingSession::startDate() const {
  SXMutexLock lock(mutex_);
  return startDate_;
}

std::shared_ptr<FernReportingSession> SXReportingSession::fernReportingSession() const {
  SXMutexLock lock(mutex_);
  return fernReportingSession_;
}

std::shared_ptr<FernSecureHierarchyToken> SXReportingSession::fernReportingAgentToken() const {
  SXMutexLock lock(mutex_);
  return fernReportingAgentToken_;
}

std::string SXReportingSession::description() const {
  return "<SXReportingSession reporterID=" + std::to_string(reporterID()) +
         " service=" + serviceName() + " started=" + (started() ? "1" : "0") + ">";
}
