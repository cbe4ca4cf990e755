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

// Puts rewritten members in key order. Of keys that became equal the last in the payload's
// order wins, as assigning them one after another would have it.
template <typename Value>
void orderRewrittenMembers(std::vector<std::pair<std::string, Value>>& members) {
  std::stable_sort(members.begin(), members.end(),
                   [](const auto& a, const auto& b) { return a.first < b.first; });
  auto kept = members.begin();
  for (auto it = members.begin(); it != members.end(); ++it) {
    if (std::next(it) != members.end() && std::next(it)->first == it->first) continue;
    if (kept != it) *kept = std::move(*it);
    ++kept;
  }
  members.erase(kept, members.end());
}

std::string underscored(std::string_view key) {
  std::string name(key);
  std::replace(name.begin(), name.end(), ' ', '_');
  return name;
}

// The payload's members under their rewritten keys, in key order.
std::vector<std::pair<std::string, const SXValue*>> underscoredMembers(const SXValue& payload) {
  std::vector<std::pair<std::string, const SXValue*>> members;
  if (!payload.is_object()) return members;
  members.reserve(payload.size());
  for (auto it = payload.cbegin(); it != payload.cend(); ++it) {
    members.emplace_back(underscored(it.key()), &it.value());
  }
  orderRewrittenMembers(members);
  return members;
}

// The rewrite's text made from the caller's dictionary text: each member's value text copied
// under its rewritten key, in the rewritten order. Nothing when a key is not plain ASCII, whose
// order in the text might not be that of the dictionary's keys; the caller then writes it anew.
std::optional<std::string> underscoredText(std::string_view callerText) {
  auto members = SXDictionaryTextMembers(callerText);
  if (!members) return std::nullopt;
  std::vector<std::pair<std::string, std::string_view>> renamed;
  renamed.reserve(members->size());
  for (const auto& [key, value] : *members) {
    if (std::any_of(key.begin(), key.end(), [](char c) { return c & 0x80; })) return std::nullopt;
    renamed.emplace_back(underscored(key), value);
  }
  orderRewrittenMembers(renamed);
  std::string text;
  text.reserve(callerText.size());
  text += '{';
  for (const auto& [key, value] : renamed) {
    if (text.size() > 1) text += ',';
    text.append("\"").append(key).append("\":").append(value);
  }
  text += '}';
  return text;
}

}  // namespace

SXValue SXReportingSessionUnderscoreKeys(const SXValue& payload) {
  SXValue rewritten = SXValue::object();
  for (const auto& [key, value] : underscoredMembers(payload)) rewritten[key] = *value;
  return rewritten;
}

std::string SXReportingSessionUnderscoreKeysText(const SXValue& payload) {
  auto members = underscoredMembers(payload);
  std::vector<SXTextMember> text;
  text.reserve(members.size());
  for (const auto& [key, value] : members) text.push_back({key, value});
  return SXDictionaryText(text);
}

bool SXReportingMessagePayload::rewritesLocked() {
  if (!rewrites_) rewrites_ = SXReportingSessionHasSpacedKeys(*caller_);
  return *rewrites_;
}

std::shared_ptr<const SXValue> SXReportingMessagePayload::rewrittenLocked() {
  if (!rewritten_) {
    // A payload without spaced keys is its own rewrite: shared, not copied. A copy holds the
    // caller's payload, so that whatever the caller's payload carries (its client's charge of
    // bytes) lasts as long as either.
    if (rewritesLocked()) {
      struct Rewrite {
        SXValue value;
        std::shared_ptr<const SXValue> caller;
      };
      auto rewrite = std::make_shared<const Rewrite>(
          Rewrite{SXReportingSessionUnderscoreKeys(*caller_), caller_});
      rewritten_ = std::shared_ptr<const SXValue>(rewrite, &rewrite->value);
    } else {
      rewritten_ = caller_;
    }
  }
  return rewritten_;
}

std::shared_ptr<const SXValue> SXReportingMessagePayload::rewritten() {
  SXMutexLock lock(mutex_);
  if (!caller_ && !rewritten_) {
    // Asked for after the dictionaries were released: the text is a dump, so it parses.
    return std::make_shared<const SXValue>(SXValue::parse(*text_));
  }
  return rewrittenLocked();
}

const std::shared_ptr<const std::string>& SXReportingMessagePayload::callerTextLocked() {
  if (!callerText_) callerText_ = std::make_shared<const std::string>(SXValueText(*caller_));
  return callerText_;
}

const std::string& SXReportingMessagePayload::makeTextLocked() {
  if (text_) return *text_;
  if (!rewritesLocked()) {
    text_ = callerTextLocked();
  } else if (rewritten_) {
    text_ = std::make_shared<const std::string>(SXValueText(*rewritten_));
  } else {
    std::optional<std::string> text;
    if (caller_->is_object()) text = underscoredText(*callerTextLocked());
    text_ = std::make_shared<const std::string>(
        text ? std::move(*text) : SXReportingSessionUnderscoreKeysText(*caller_));
  }
  return *text_;
}

const std::string& SXReportingMessagePayload::textLocked() {
  makeTextLocked();
  caller_ = nullptr;
  rewritten_ = nullptr;
  if (holds_ == 0) callerText_ = nullptr;
  return *text_;
}

std::shared_ptr<const std::string> SXReportingMessagePayload::text() {
  SXMutexLock lock(mutex_);
  textLocked();
  return text_;
}

void SXReportingMessagePayload::keepOnlyText() {
  SXMutexLock lock(mutex_);
  textLocked();
}

std::shared_ptr<const std::string> SXReportingMessagePayload::payloadText() {
  SXMutexLock lock(mutex_);
  if (callerText_) return callerText_;
  if (!caller_ || !caller_->is_object()) return nullptr;
  // The dictionaries stay: a standalone send of a session not started reads them.
  return callerTextLocked();
}

void SXReportingMessagePayload::hold() {
  SXMutexLock lock(mutex_);
  ++holds_;
}

void SXReportingMessagePayload::release() {
  SXMutexLock lock(mutex_);
  // Once only the stored text is kept, the last reader lets the caller's go.
  if (--holds_ == 0 && !caller_ && text_) callerText_ = nullptr;
}

SXValue SXReportingAggregateEntry::toValue() const {
  if (dictionary_) return *dictionary_;
  return SXValue{{messageId_, *payload_->rewritten()}};
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
