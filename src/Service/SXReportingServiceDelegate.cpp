#include "SXReportingServiceDelegate.h"

#include <algorithm>

#include "SXReportingServiceExport.h"
#include "common/SXValueText.h"

namespace {

constexpr const char* kDefaultsDomain = "com.vendra.sonex";
constexpr const char* kDefaultsNotification = "com.vendra.sonex.reporting";
constexpr const char* kUptimeEvent = "com.vendra.sonex.sxreportingclientuptime";

void connectionInterrupted(SXReportingEnvironment& environment,
                           const std::weak_ptr<SXReportingServerInstance>& weakInstance) {
  SXLOG(environment.log(), environment.serviceLogScope(), SXLogLevel::kDefault,
        "InterruptionHandler: connection exited");
  if (auto instance = weakInstance.lock()) instance->handleConnectionError();
}

// The end of a connection: connection-error work, then the client uptime event.
void connectionInvalidated(SXReportingEnvironment& environment,
                           const std::weak_ptr<SXReportingServerInstance>& weakInstance,
                           int32_t pid) {
  auto& log = environment.log();
  auto* scope = environment.serviceLogScope();
  auto instance = weakInstance.lock();
  if (instance) instance->handleConnectionError();

  SXDate now = environment.platform().clock->now();
  SXValue seconds = -1;
  auto name = instance ? instance->clientProcessName() : std::nullopt;
  std::string nameOrUnknown = name.value_or("unknown");
  auto start = instance ? instance->clientStartDate() : std::nullopt;
  if (!start) {
    SXLOG(log, scope, SXLogLevel::kDefault,
          "clientStartDate is nil. clientpid=%d clientprocessname=%@", pid, nameOrUnknown);
  } else {
    seconds = std::abs(SXSecondsBetween(*start, now));
    if (*start > now) {
      SXLOG(log, scope, SXLogLevel::kDefault,
            "clientStartDate is in the past. clientpid=%d clientprocessname=%@", pid,
            nameOrUnknown);
    }
  }
  SXLOG(log, scope, SXLogLevel::kDefault,
        "InvalidationHandler: connection exited process=%@ uptime_sec=%d", name,
        static_cast<int>(seconds.get<double>()));

  name = instance ? instance->clientProcessName() : std::nullopt;
  if (!name) {
    SXLOG(log, scope, SXLogLevel::kDefault, "clientProcessName is nil. clientpid=%d", pid);
    return;
  }
  SXValue payload = {{"processName", *name}, {"seconds", seconds}};
  environment.platform().tallyvane->sendEventLazy(kUptimeEvent, [payload] { return payload; });
}

}  // namespace

SXValue SXReportingDefaults(SXPreferences& preferences) {
  SXValue defaults = SXValue::object();
  if (auto name = preferences.copyValue(kDefaultsDomain, "device_name")) {
    if (auto text = SXPreferencesValueAsString(*name)) defaults["device_name"] = *text;
  }
  if (auto disable = preferences.copyValue(kDefaultsDomain, "disable_reporting")) {
    defaults["disable_reporting"] = SXPreferencesValueAsBool(*disable);
  } else {
    defaults["disable_reporting"] = 0;
  }
  return defaults;
}

std::shared_ptr<SXReportingServiceDelegate> SXReportingServiceDelegate::init(
    std::shared_ptr<SXReportingEnvironment> environment) {
  environment->setServiceLogScope(
      environment->log().registerScope(SXReportingLogScope("sxrs", "reporting_server_verbose")));
  std::shared_ptr<SXReportingServiceDelegate> delegate(
      new SXReportingServiceDelegate(std::move(environment)));
  auto& env = *delegate->environment_;
  env.setServerQueue(env.platform().dispatch->createSerialQueue(
      "com.vendra.sonex.reporting.server", SXQualityOfService::kUserInteractive));
  delegate->listenForDefaultsNotification();
  delegate->driverUtility_ = std::make_unique<SXReportingDriverUtility>(env);
  return delegate;
}

SXReportingServiceDelegate::SXReportingServiceDelegate(
    std::shared_ptr<SXReportingEnvironment> environment)
    : environment_(std::move(environment)),
      refusalLines_(environment_->limits().maxErrorLines, "refused connections") {}

void SXReportingServiceDelegate::listenForDefaultsNotification() {
  int token = -1;
  int status = environment_->platform().notifications->registerDispatch(
      kDefaultsNotification, token, environment_->serverQueue(),
      [self = shared_from_this()](int delivered) { self->defaultsChanged(delivered); });
  environment_->setDefaultsNotifyToken(token);
  SXLOG(log(), scope(), SXLogLevel::kDefault, "notify setup result %i", status);
}

void SXReportingServiceDelegate::defaultsChanged(int token) {
  if (token != environment_->defaultsNotifyToken()) return;
  SXLOG(log(), scope(), SXLogLevel::kDefault, "re-reading sonex defaults");
  SXValue defaults = SXReportingDefaults(*environment_->platform().preferences);
  {
    SXMutexLock lock(defaultsMutex_);
    defaults_ = defaults;
  }
  SXLOG(log(), scope(), SXLogLevel::kInfo, "defaults %@", defaults);
  for (const auto& client : clients_) {
    for (const auto& [id, session] : client->clientReportingSessionMap()) {
      session->updateDefaults(&defaults);
    }
  }
  if (auto disable = defaults.find("disable_reporting"); disable != defaults.end()) {
    reportingEnabled_.store(!SXPreferencesValueAsBool(*disable));
  }
}

std::optional<SXValue> SXReportingServiceDelegate::getDefaults() {
  SXMutexLock lock(defaultsMutex_);
  return defaults_;
}

bool SXReportingServiceDelegate::admitConnection(int32_t pid) {
  SXMutexLock lock(connectionsMutex_);
  uint64_t& live = connectionsPerProcess_[pid];
  uint64_t limit = environment_->limits().maxConnectionsPerClient;
  if (live < limit) {
    ++live;
    return true;
  }
  environment_->counters().dropped(SXReportingGuardrail::kConnectionsPerClient);
  if (refusalLines_.allow(*environment_)) {
    SXLOG(log(), scope(), SXLogLevel::kError,
          "refusing a connection of process %i: it already has %llu (--max-connections-per-client)",
          pid, static_cast<unsigned long long>(limit));
  }
  return false;
}

void SXReportingServiceDelegate::connectionEnded(int32_t pid) {
  SXMutexLock lock(connectionsMutex_);
  auto it = connectionsPerProcess_.find(pid);
  if (it != connectionsPerProcess_.end() && --it->second == 0) connectionsPerProcess_.erase(it);
}

bool SXReportingServiceDelegate::shouldAcceptNewConnection(
    const std::shared_ptr<SXIpcConnection>& connection) {
  int32_t pid = connection->processIdentifier();
  if (!admitConnection(pid)) return false;
  SXLOG(log(), scope(), SXLogLevel::kDefault, "newConnection: %@", connection->description());
  std::shared_ptr<SXReportingServerInstance> instance;
  {
    SXMutexLock lock(mutex_);
    instance = SXReportingServerInstance::initWithPID(environment_, pid, weak_from_this(),
                                                      connection->budget());
    connection->setExportedObject(std::make_shared<SXReportingServiceExport>(
        instance, weak_from_this(), environment_, connection->budget()));
  }
  std::weak_ptr<SXReportingServerInstance> weakInstance = instance;
  instance.reset();  // the connection holds it from here on
  environment_->serverQueue()->async(
      [self = shared_from_this(), weakInstance, pid] { self->registerClient(weakInstance, pid); });
  auto environment = environment_;
  connection->setInterruptionHandler(
      [environment, weakInstance] { connectionInterrupted(*environment, weakInstance); });
  connection->setInvalidationHandler([environment, weakInstance, pid, weakSelf = weak_from_this()] {
    connectionInvalidated(*environment, weakInstance, pid);
    if (auto self = weakSelf.lock()) self->connectionEnded(pid);
  });
  connection->resume();
  return true;
}

void SXReportingServiceDelegate::registerClient(
    const std::weak_ptr<SXReportingServerInstance>& weakInstance, int32_t pid) {
  auto instance = weakInstance.lock();
  if (!instance) return;
  clients_.push_back(instance);
  instance->setClientStartDate(environment_->platform().clock->now());
  const SXProcessInfo& process = *environment_->platform().process;
  std::optional<std::string> name;
  if (pid == process.processIdentifier()) {
    name = process.processName();
  } else if (pid >= 1) {
    name = process.commandName(pid);
  }
  instance->setClientProcessName(std::move(name));
}

std::shared_ptr<SXReportingSession> SXReportingServiceDelegate::findReportingSessionForID(
    int64_t reporterID, SXReportingErrorLines* errorLines) {
  SXMutexLock lock(mutex_);
  if (reporterID == 0 || !reportingEnabled_.load()) return nullptr;
  for (const auto& client : clients_) {
    const auto& sessions = client->clientReportingSessionMap();
    if (auto it = sessions.find(reporterID); it != sessions.end()) {
      SXLOG(log(), scope(), SXLogLevel::kInfo, "found reporting session %lli for client %i",
            reporterID, client->processIdentifier());
      return it->second;
    }
  }
  if (!errorLines || errorLines->allow(*environment_)) {
    SXLOG(log(), scope(), SXLogLevel::kError, "failed to find reporting session %lli", reporterID);
  }
  return nullptr;
}

void SXReportingServiceDelegate::removeClient(
    const std::shared_ptr<SXReportingServerInstance>& client) {
  std::erase(clients_, client);
}

SXValue SXReportingServiceDelegate::statusSnapshot() const {
  SXDate now = environment_->platform().clock->now();
  SXValue clients = SXValue::array();
  for (const auto& client : clients_) {
    SXValue sessions = SXValue::array();
    for (const auto& [id, session] : client->clientReportingSessionMap()) {
      sessions.push_back({{"reporterID", id},
                          {"serviceType", session->serviceType()},
                          {"serviceName", session->serviceName()},
                          {"started", session->started()}});
    }
    auto name = client->clientProcessName();
    auto start = client->clientStartDate();
    clients.push_back(
        {{"pid", client->processIdentifier()},
         {"processName", name ? SXValue(*name) : SXValue()},
         {"uptimeSeconds", start ? SXValue(SXSecondsBetween(*start, now)) : SXValue()},
         {"sessions", std::move(sessions)}});
  }
  SXValue status = {{"clients", std::move(clients)},
                    {"reportingEnabled", reportingEnabled_.load()},
                    {"counters", countersValue()},
                    {"gauges", gaugesValue()}};
  SXMutexLock lock(defaultsMutex_);
  status["defaults"] = defaults_ ? *defaults_ : SXValue();
  return status;
}

void SXReportingServiceDelegate::setStatusProviders(SXReportingStatusProviders providers) {
  SXMutexLock lock(providersMutex_);
  providers_ = std::move(providers);
}

SXValue SXReportingServiceDelegate::countersValue() const {
  SXValue counters = environment_->counters().toValue();
  SXMutexLock lock(providersMutex_);
  const auto& p = providers_;
  counters["guardrail_dropped"]["requests_backpressure"] =
      p.requestsBackpressure ? p.requestsBackpressure() : 0;
  counters["guardrail_dropped"]["partial_frames"] = p.partialFrames ? p.partialFrames() : 0;
  SXValue errors = SXValue::object();
  if (p.tallyvaneWriteErrors) errors["tallyvane"] = p.tallyvaneWriteErrors();
  if (p.joulebookWriteErrors) errors["joulebook"] = p.joulebookWriteErrors();
  if (p.fernReportingWriteErrors) errors["fernreporting"] = p.fernReportingWriteErrors();
  if (!errors.empty()) counters["store_write_errors"] = std::move(errors);
  if (p.retentionCounters) counters.update(p.retentionCounters());
  return counters;
}

// Server queue: the client list is read here.
SXValue SXReportingServiceDelegate::gaugesValue() const {
  SXValue gauges = {{"sessions_live", environment_->counters().sessionsLive()},
                    {"clients_live", static_cast<uint64_t>(clients_.size())},
                    {"aggregate_bytes", environment_->counters().aggregateBytes()}};
  SXMutexLock lock(providersMutex_);
  if (providers_.inflightBytes) gauges["inflight_bytes"] = providers_.inflightBytes();
  if (providers_.spoolBacklog) gauges["spool_backlog"] = providers_.spoolBacklog();
  if (providers_.retentionGauges) gauges.update(providers_.retentionGauges());
  return gauges;
}
