// The server instance: registry operations, routing, start/stop/destroy, connection errors.
#include "SXReportingServerInstance.h"

#include <algorithm>

#include "Statistics/SXReportingJoulebookUtility.h"
#include "Statistics/SXReportingTallyvaneBridge.h"

namespace {

constexpr uint32_t kTraceCreate = 0x21042814;
constexpr uint32_t kTraceStart = 0x21042818;
constexpr uint32_t kTraceStop = 0x2104281C;
constexpr uint32_t kTraceDestroy = 0x21042820;
constexpr uint32_t kTraceSend = 0x21042824;
constexpr SXReportingServiceType kStandaloneServiceType = 5;
constexpr SXReportingCategory kDriverStatisticsCategory = 9;

// "(a, b, ...)": how a list of sessions prints.
class SessionListText {
 public:
  void add(std::string_view description) { (text_ += text_.size() > 1 ? ", " : "") += description; }
  // The finished list; called once.
  std::string_view finish() {
    text_ += ')';
    return text_;
  }

 private:
  std::string text_ = "(";
};

}  // namespace

std::shared_ptr<SXReportingServerInstance> SXReportingServerInstance::initWithPID(
    std::shared_ptr<SXReportingEnvironment> environment, int32_t processIdentifier,
    std::weak_ptr<SXReportingServiceDelegateProtocol> delegate,
    std::shared_ptr<SXByteBudget> budget) {
  SXLOG(environment->log(), environment->serviceLogScope(), SXLogLevel::kDefault,
        "new client with pid %lu", static_cast<uint64_t>(static_cast<uint32_t>(processIdentifier)));
  return std::shared_ptr<SXReportingServerInstance>(new SXReportingServerInstance(
      std::move(environment), processIdentifier, std::move(delegate), std::move(budget)));
}

SXReportingServerInstance::SXReportingServerInstance(
    std::shared_ptr<SXReportingEnvironment> environment, int32_t processIdentifier,
    std::weak_ptr<SXReportingServiceDelegateProtocol> delegate,
    std::shared_ptr<SXByteBudget> budget)
    : environment_(std::move(environment)),
      processIdentifier_(processIdentifier),
      delegate_(std::move(delegate)),
      budget_(std::move(budget)),
      standaloneBudget_(std::make_shared<SXReportingPendingBudget>(
          environment_->limits().maxPendingStandaloneBytes, processIdentifier)),
      errorLines_(environment_->limits().maxErrorLines,
                  "client " + std::to_string(processIdentifier)) {}

SXReportingServerInstance::~SXReportingServerInstance() {
  SXLOG(log(), scope(), SXLogLevel::kDefault, "dealloc %i from the server client list",
        processIdentifier_);
  environment_->counters().sessionsRemoved(sessions_.size());
  errorLines_.reportSuppressed(*environment_);
}

std::shared_ptr<SXReportingSession> SXReportingServerInstance::ownSession(
    int64_t reporterID) const {
  auto it = sessions_.find(reporterID);
  return it == sessions_.end() ? nullptr : it->second;
}

std::shared_ptr<SXReportingSession> SXReportingServerInstance::findReportingSessionForID(
    int64_t reporterID) {
  if (auto session = ownSession(reporterID)) return session;
  auto delegate = delegate_.lock();
  return delegate ? delegate->findReportingSessionForID(reporterID, &errorLines_) : nullptr;
}

// Request lines are verbose lines of the service scope, written on the connection's thread.
#define SXR_REQUEST_LINE(...)                                 \
  do {                                                        \
    if (log().isEnabled(scope(), kSXLogVerboseLevel)) {       \
      SXLOG(log(), scope(), SXLogLevel::kDebug, __VA_ARGS__); \
    }                                                         \
  } while (0)

void SXReportingServerInstance::createReportingSession(int64_t reporterID, Reply<bool> reply) {
  SXR_REQUEST_LINE("creating session for reporter %lli", reporterID);
  enqueue([fn = __func__, reporterID, reply = std::move(reply)](SXReportingServerInstance& self) {
    self.environment_->tracer().trace(kTraceCreate);
    if (!self.hasRoomForSession(reporterID, fn)) {
      reply(true);
      return;
    }
    auto session = SXReportingSession::initWithID(self.environment_, reporterID,
                                                  SXValue::array({self.processIdentifier_}),
                                                  self.standaloneBudget_);
    if (session) {
      auto [it, added] = self.sessions_.insert_or_assign(reporterID, std::move(session));
      if (added) self.environment_->counters().sessionsAdded(1);
      SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault,
               "session created for reporter %lli", reporterID);
    }
    reply(true);
  });
}

bool SXReportingServerInstance::hasRoomForSession(int64_t reporterID, const char* fn) {
  if (sessions_.count(reporterID)) return true;
  const SXReportingLimits& limits = environment_->limits();
  SXReportingCounters& counters = environment_->counters();
  if (sessions_.size() >= limits.maxSessionsPerClient) {
    counters.dropped(SXReportingGuardrail::kSessionsPerClient);
    if (!errorLines_.allow(*environment_)) return false;
    SXLOG_IN(fn, log(), scope(), SXLogLevel::kError,
             "session limit reached: client %i already has %llu sessions "
             "(--max-sessions-per-client); reporter %lli not created",
             processIdentifier_, static_cast<unsigned long long>(sessions_.size()), reporterID);
    return false;
  }
  if (counters.sessionsLive() >= limits.maxSessions) {
    counters.dropped(SXReportingGuardrail::kSessionsTotal);
    if (!errorLines_.allow(*environment_)) return false;
    SXLOG_IN(fn, log(), scope(), SXLogLevel::kError,
             "session limit reached: the service already has %llu sessions (--max-sessions); "
             "reporter %lli of client %i not created",
             static_cast<unsigned long long>(counters.sessionsLive()), reporterID,
             processIdentifier_);
    return false;
  }
  return true;
}

void SXReportingServerInstance::setServiceType(SXReportingServiceType serviceType,
                                               int64_t reporterID, Reply<bool> reply) {
  SXR_REQUEST_LINE("setting service type %i for reporter %lli", serviceType, reporterID);
  enqueue([fn = __func__, serviceType, reporterID,
           reply = std::move(reply)](SXReportingServerInstance& self) {
    if (reporterID == 0) return;
    if (auto session = self.ownSession(reporterID)) {
      session->setServiceType(serviceType);
      SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault,
               "service type %i set for reporter  %lli", serviceType, reporterID);
    }
    reply(true);
  });
}

void SXReportingServerInstance::getServiceNameForReporterID(int64_t reporterID,
                                                            Reply<SXReportingServiceType> reply) {
  SXR_REQUEST_LINE("fetching seviceType");
  enqueue([fn = __func__, reporterID, reply = std::move(reply)](SXReportingServerInstance& self) {
    if (reporterID == 0) {
      reply(kSXReportingServiceTypeUnknown);
      return;
    }
    auto session = self.findReportingSessionForID(reporterID);
    SXReportingServiceType type = session ? session->serviceType() : kSXReportingServiceTypeUnknown;
    reply(type);
    SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault,
             "returnning service type %i for reporter  %lli", type, reporterID);
  });
}

void SXReportingServerInstance::setConfiguration(std::optional<SXValue> configuration,
                                                 int64_t reporterID, Reply<bool> reply) {
  SXR_REQUEST_LINE("setting configuration");
  enqueue([configuration = std::move(configuration), reporterID,
           reply = std::move(reply)](SXReportingServerInstance& self) {
    if (auto session = self.findReportingSessionForID(reporterID)) {
      session->setConfiguration(configuration ? &*configuration : nullptr);
    }
    reply(true);
  });
}

void SXReportingServerInstance::reporterID(int64_t reporterID, Reply<SXValue> valid) {
  SXR_REQUEST_LINE("validating reporter %lli", reporterID);
  enqueue([fn = __func__, reporterID, valid = std::move(valid)](SXReportingServerInstance& self) {
    SXValue reply = {{"reporterID", int64_t{0}}, {"serviceType", kSXReportingServiceTypeUnknown}};
    if (auto session = self.findReportingSessionForID(reporterID)) {
      reply["reporterID"] = reporterID;
      reply["serviceType"] = session->serviceType();
    }
    SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault, "validating reporter %lli",
             reporterID);
    valid(std::move(reply));
  });
}

void SXReportingServerInstance::getAllReporters(Reply<std::vector<int64_t>> reply) {
  enqueue([reply = std::move(reply)](SXReportingServerInstance& self) {
    std::vector<int64_t> reporters;
    if (auto delegate = self.delegate_.lock()) {
      for (const auto& client : delegate->getAllClients()) {
        for (const auto& [id, session] : client->sessions_) reporters.push_back(id);
      }
    }
    reply(std::move(reporters));
  });
}

void SXReportingServerInstance::sendMessage(std::shared_ptr<const SXPackedValue> message,
                                            SXReportingCategory category,
                                            SXReportingMessageType type,
                                            std::optional<std::vector<int64_t>> reporterIDs,
                                            Reply<std::optional<SXError>> reply) {
  SXR_REQUEST_LINE("sending message for reporter %@",
                   reporterIDs ? SXValue(*reporterIDs) : SXValue());
  environment_->counters().messageReceived();
  enqueue([message = std::move(message), category, type, reporterIDs = std::move(reporterIDs),
           reply = std::move(reply)](SXReportingServerInstance& self) {
    self.environment_->tracer().trace(kTraceSend);
    auto delegate = self.delegate_.lock();
    if (!delegate || !delegate->isReportingEnabled()) {
      reply(SXError{kSXReportingErrorDomain, kSXReportingErrorReportingDisabled});
      return;
    }
    if (reporterIDs) {
      self.routeAddressed(message, category, type, *reporterIDs);
    } else {
      self.routeBroadcast(message, category, type);
    }
    reply(std::nullopt);
  });
}

std::shared_ptr<const SXPackedValue> SXReportingServerInstance::chargeDeliveries(
    std::shared_ptr<const SXPackedValue> message, size_t deliveries) const {
  if (!budget_ || deliveries < 2) return message;
  uint64_t perDelivery = 512 + 2 * uint64_t{message->size()};
  return SXChargedAlias(std::move(message),
                        SXByteBudget::Charge(budget_, (deliveries - 1) * perDelivery));
}

void SXReportingServerInstance::routeAddressed(std::shared_ptr<const SXPackedValue> message,
                                               SXReportingCategory category,
                                               SXReportingMessageType type,
                                               const std::vector<int64_t>& reporterIDs) {
  std::vector<std::shared_ptr<SXReportingSession>> sessions;
  for (int64_t reporterID : reporterIDs) {
    if (reporterID == 0) continue;
    if (auto session = findReportingSessionForID(reporterID))
      sessions.push_back(std::move(session));
  }
  if (sessions.empty()) return;
  message = chargeDeliveries(std::move(message), sessions.size());
  auto prepared = std::make_shared<SXReportingMessagePayload>(message);
  SXReportingEventTexts events(message);
  for (const auto& session : sessions) {
    SXReportingTallyvaneBridge::handleEvent(*environment_, events, category, type, *session);
    environment_->counters().delivered(SXReportingSink::kTallyvane);
    SXReportingJoulebookUtility::handleEvent(*environment_, *message, category, type, *session);
    session->sendMessage(message, category, type, nullptr, prepared);
  }
}

void SXReportingServerInstance::routeBroadcast(const std::shared_ptr<const SXPackedValue>& message,
                                               SXReportingCategory category,
                                               SXReportingMessageType type) {
  auto delegate = delegate_.lock();
  // Every broadcast lists every session twice: each description is made once.
  std::vector<std::shared_ptr<SXReportingSession>> active;
  SessionListText activeText;
  for (const auto& client : delegate->getAllClients()) {
    SessionListText clientText;
    for (const auto& [id, session] : client->sessions_) {
      std::string description = session->description();
      clientText.add(description);
      if (session->started()) {
        active.push_back(session);
        activeText.add(description);
      }
    }
    SXLOG(log(), scope(), SXLogLevel::kDefault, "sessions for client %i : %@",
          client->processIdentifier_, clientText.finish());
  }
  SXLOG(log(), scope(), SXLogLevel::kDefault, "active reporting sessions %lu : %@",
        static_cast<uint64_t>(active.size()), activeText.finish());
  if (active.empty()) {
    SXLOG(log(), scope(), SXLogLevel::kDefault,
          "no active reporting sessions found, sending as standalone");
    auto defaults = delegate->getDefaults();
    SXReportingSession::sendSingleMessage(
        environment_, SXReportingDecodedPayload(message->value(), message), category, type,
        kStandaloneServiceType, defaults ? &*defaults : nullptr, nullptr);
    return;
  }
  auto charged = chargeDeliveries(message, active.size());
  auto prepared = std::make_shared<SXReportingMessagePayload>(charged);
  SXReportingEventTexts events(charged);
  for (const auto& session : active) {
    session->sendMessage(charged, category, type, nullptr, prepared);
    SXReportingTallyvaneBridge::handleEvent(*environment_, events, category, type, *session);
    environment_->counters().delivered(SXReportingSink::kTallyvane);
    SXReportingJoulebookUtility::handleEvent(*environment_, *message, category, type, *session);
  }
}

void SXReportingServerInstance::startReportingSessionForID(int64_t reporterID, Reply<bool> reply) {
  SXR_REQUEST_LINE("starting session for reporter %lli", reporterID);
  enqueue([reporterID, reply = std::move(reply)](SXReportingServerInstance& self) {
    self.environment_->tracer().trace(kTraceStart);
    if (reporterID == 0) return;
    auto session = self.findReportingSessionForID(reporterID);
    if (!session) {
      reply(false);
      return;
    }
    if (session->started()) return;
    session->start();
    if (auto delegate = self.delegate_.lock()) session->setDriverSnapShot(delegate->getSnapShot());
    session->setTransactionCompleteBlock(std::move(reply));
  });
}

void SXReportingServerInstance::sendDriverDeltaAndStop(
    const std::shared_ptr<SXReportingSession>& session) {
  auto delegate = delegate_.lock();
  auto statistics = delegate
                        ? delegate->getDriverStatisticsRelativeToSnapShot(session->driverSnapShot())
                        : std::nullopt;
  if (statistics) {
    session->sendMessage(*statistics, kDriverStatisticsCategory, 0, nullptr);
    SXLOG(log(), scope(), SXLogLevel::kDefault, "fetching driver logs %@", *statistics);
  } else {
    SXLOG(log(), scope(), SXLogLevel::kDefault, "nothing interesting to fetch from the drivers");
  }
  session->setDriverSnapShot(std::nullopt);
  session->stop();
}

void SXReportingServerInstance::stopReportingSessionForID(int64_t reporterID, Reply<bool> reply) {
  SXR_REQUEST_LINE("stopping session for reporter %lli", reporterID);
  enqueue([fn = __func__, reporterID, reply = std::move(reply)](SXReportingServerInstance& self) {
    self.environment_->tracer().trace(kTraceStop);
    if (reporterID == 0) return;
    if (auto session = self.findReportingSessionForID(reporterID)) {
      self.sendDriverDeltaAndStop(session);
    }
    SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault, "stopping %lli", reporterID);
    reply(true);
  });
}

void SXReportingServerInstance::destroyReportingSession(int64_t reporterID, Reply<bool> reply) {
  SXR_REQUEST_LINE("destroying session for reporter %lli", reporterID);
  enqueue([fn = __func__, reporterID, reply = std::move(reply)](SXReportingServerInstance& self) {
    self.environment_->tracer().trace(kTraceDestroy);
    if (reporterID == 0) return;
    if (auto session = self.ownSession(reporterID)) {
      if (session->started()) session->stop();
      self.sessions_.erase(reporterID);
      self.environment_->counters().sessionsRemoved(1);
    }
    SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault, "destroying %lli", reporterID);
    reply(true);
  });
}

void SXReportingServerInstance::killService(Reply<bool> /*never sent*/) {
  SXLOG(log(), scope(), SXLogLevel::kDefault, "DESTROYING SERVICE");
  log().flush();
  environment_->platform().process->exitProcess(2);
}

void SXReportingServerInstance::handleConnectionError() {
  enqueue([fn = __func__](SXReportingServerInstance& self) {
    auto delegate = self.delegate_.lock();
    if (!delegate) return;
    const auto& clients = delegate->getAllClients();
    auto self_ptr = self.shared_from_this();
    if (std::find(clients.begin(), clients.end(), self_ptr) == clients.end()) return;
    for (const auto& [id, session] : self.sessions_) {
      if (session->started()) session->stop();
    }
    delegate->removeClient(self_ptr);
    SXLOG_IN(fn, self.log(), self.scope(), SXLogLevel::kDefault,
             "removing %i from the server client list", self.processIdentifier_);
  });
}

std::optional<SXDate> SXReportingServerInstance::clientStartDate() const {
  SXMutexLock lock(mutex_);
  return clientStartDate_;
}

void SXReportingServerInstance::setClientStartDate(std::optional<SXDate> date) {
  SXMutexLock lock(mutex_);
  clientStartDate_ = date;
}

std::optional<std::string> SXReportingServerInstance::clientProcessName() const {
  SXMutexLock lock(mutex_);
  return clientProcessName_;
}

void SXReportingServerInstance::setClientProcessName(std::optional<std::string> name) {
  SXMutexLock lock(mutex_);
  clientProcessName_ = std::move(name);
}
