// sxreportingd: the reporting service of the audio stack.
#include <sys/stat.h>
#include <unistd.h>

#include <asio/post.hpp>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <future>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <thread>

#include "SXReportingLifecycle.h"
#include "SXVersion.h"
#include "Service/SXReportingDaemonConfig.h"
#include "Service/SXReportingServiceDelegate.h"
#include "common/SXCommandLine.h"
#include "common/SXPaths.h"
#include "export/OtlpHttpExporter.h"
#include "linux/AsioDispatch.h"
#include "linux/FileKestrel.h"
#include "linux/InotifyNotifications.h"
#include "linux/JsonDeviceProperties.h"
#include "linux/JsonPreferences.h"
#include "linux/NoSensorOrientation.h"
#include "linux/PosixFileSystem.h"
#include "linux/ProcProcessInfo.h"
#include "linux/ServiceManager.h"
#include "linux/StderrLog.h"
#include "linux/SystemClock.h"
#include "linux/SystemRandom.h"
#include "linux/UnixSocketIpc.h"
#include "linux/UsdtTracer.h"
#include "sqlite/Retention.h"
#include "sqlite/SqliteFernReporting.h"
#include "sqlite/SqliteJoulebook.h"
#include "sqlite/SqliteTallyvane.h"

#ifdef SXR_JEMALLOC
// jemalloc's options, read when it starts: two arenas for our two cores, and freed pages
// handed back to the system within a second of a burst rather than ten.
extern "C" const char* malloc_conf;
const char* malloc_conf = "narenas:2,dirty_decay_ms:1000,muzzy_decay_ms:0";
#endif

namespace {

struct Options {
  SXPaths paths = SXPaths::fromEnvironment();
  std::string logScopes;
  size_t maxMessageBytes = 1 << 20;
  unsigned socketMode = 0660;
  SXReportingLimits limits;
  // Limits given as options or environment variables: the configuration file cannot change them.
  std::set<std::string> fixedLimits;
  uint64_t drainTimeoutMs = 10'000;
};

constexpr const char* kDescription =
    "The reporting service of the audio stack. Clients connect over a Unix socket and speak\n"
    "MessagePack-RPC (see sxreportctl(1) and docs/protocol.md).\n"
    "\n"
    "Each option can also be set by the environment variable named in parentheses.";

constexpr const char* kFooter =
    "Signals: SIGTERM and SIGINT stop after storing everything answered (exit status 0); a\n"
    "second one during that drain exits at once (status 1). SIGHUP re-reads fernreporting.json,\n"
    "device.json and sxreportingd.json.\n"
    "\n"
    "Exit status:\n"
    "  0  stopped by SIGTERM or SIGINT once the drain ended; --help and --version\n"
    "  1  the drain was cut short (its time-out, or a second SIGTERM or SIGINT), or a\n"
    "     directory could not be created or the socket not listened on\n"
    "  2  usage error: a bad option or environment variable, or sxreportingd.json not valid\n"
    "     at start; also the kill request (sxreportctl kill), which the daemon never answers\n"
    "\n"
    "The limits can also be set in <config-dir>/sxreportingd.json, e.g.\n"
    "{\"limits\": {\"max-payload-bytes\": 131072}}; options and environment variables win.\n"
    "\n"
    "With no options and not root, everything lives under ./var of the working directory.";

// Returns nothing to go on, or the exit status.
std::optional<int> parseOptions(int argc, char** argv, Options& options) {
  CLI::App app(kDescription, "sxreportingd");
  SXSetUpCommandLine(app, kSXVersion);
  app.footer(kFooter);
  SXPaths& p = options.paths;
  // The directories' environment twins are read by SXPaths, which sxreportctl shares.
  app.add_option("--socket", p.socketPath,
                 "socket path (SXREPORTING_SOCKET)\n"
                 "default <runtime-dir>/com.vendra.audio.kitbench.reporting.service")
      ->type_name("PATH");
  app.add_option("--state-dir", p.stateDir,
                 "analytics, power-log and spool databases (SXREPORTING_STATE_DIR)")
      ->type_name("DIR");
  app.add_option("--config-dir", p.configDir,
                 "device.json, fernreporting.json, preferences/ (SXREPORTING_CONFIG_DIR)")
      ->type_name("DIR");
  app.add_option("--runtime-dir", p.runtimeDir,
                 "socket and notify/ directory "
                 "(SXREPORTING_RUNTIME_DIR)")
      ->type_name("DIR");
  app.add_option("--preferences-dir", p.preferencesDir,
                 "preferences domains (SXREPORTING_PREFERENCES_DIR,\n"
                 "default <config-dir>/preferences;\nas root <state-dir>/preferences)")
      ->type_name("DIR");
  app.add_option("--diagnostic-logs-dir", p.diagnosticLogsDir,
                 "session summary files of internal builds\n(SXREPORTING_DIAGNOSTIC_LOGS_DIR)")
      ->type_name("DIR");
  app.add_option("--kestrel-root", p.kestrelRoot, "driver counters (SXREPORTING_KESTREL_ROOT)")
      ->type_name("DIR");
  app.add_option("--log-scope", options.logScopes,
                 "enable verbose lines, e.g. sxrs=5,sxrr=5,sxrd=5\n(SXREPORTING_LOG_SCOPES)")
      ->type_name("SCOPE=LEVEL,...")
      ->envname("SXREPORTING_LOG_SCOPES")
      ->check([](const std::string& text) {
        std::map<std::string, int> levels;
        return SXStderrLog::parseLevels(text, levels) ? "" : "not SCOPE=LEVEL,...: '" + text + "'";
      });
  app.add_option("--max-message-bytes", options.maxMessageBytes,
                 "largest request accepted (SXREPORTING_MAX_MESSAGE_BYTES,\ndefault 1048576)")
      ->type_name("N")
      ->envname("SXREPORTING_MAX_MESSAGE_BYTES")
      ->transform(SXNumber<uint64_t>(1, UINT64_MAX, "a positive number"));
  app.add_option("--socket-mode", options.socketMode,
                 "permissions of the socket, octal (SXREPORTING_SOCKET_MODE,\ndefault 0660)")
      ->type_name("MODE")
      ->envname("SXREPORTING_SOCKET_MODE")
      ->transform(SXNumber<unsigned>(0, 0777, "an octal mode up to 0777", 8));

  const SXReportingLimits defaults;
  for (const auto& limit : SXReportingLimitOptions()) {
    app.add_option(std::string("--") + limit.name, options.limits.*limit.member,
                   std::string(limit.help) + "\n(" + limit.environment + ", default " +
                       std::to_string(defaults.*limit.member) + ")")
        ->type_name("N")
        ->envname(limit.environment)
        ->group(
            "limits (a positive number each; what they refuse is logged and counted in "
            "`status`)")
        ->transform(SXNumber<uint64_t>(1, UINT64_MAX, "a positive number"));
  }
  app.add_option("--drain-timeout-ms", options.drainTimeoutMs,
                 "how long a stop (SIGTERM, SIGINT) may drain before the\n"
                 "daemon exits with what is left (SXREPORTING_DRAIN_TIMEOUT_MS,\ndefault 10000)")
      ->type_name("N")
      ->envname("SXREPORTING_DRAIN_TIMEOUT_MS")
      ->group("lifecycle")
      ->transform(SXNumber<uint64_t>(1, UINT64_MAX, "a positive number"));

  if (auto status = SXParseMainCommandLine(app, argc, argv)) return status;
  p.socketPathExplicit = p.socketPathExplicit || app.count("--socket") > 0;
  p.runtimeDirChanged();
  for (const auto& limit : SXReportingLimitOptions()) {
    if (app.count(std::string("--") + limit.name) > 0) options.fixedLimits.insert(limit.name);
  }
  return std::nullopt;
}

// The SQLite stores, kept by their own types so that status can read their write-error counts.
struct Stores {
  std::shared_ptr<SXSqliteTallyvane> tallyvane;
  std::shared_ptr<SXSqliteJoulebook> joulebook;
  std::shared_ptr<SXSqliteFernReporting> fernReporting;
};

Stores openStores(const SXPaths& p, const std::shared_ptr<SXLogFacility>& log) {
  return {std::make_shared<SXSqliteTallyvane>(p.stateDir + "/tallyvane.db", log),
          std::make_shared<SXSqliteJoulebook>(p.stateDir + "/joulebook.db", log),
          std::make_shared<SXSqliteFernReporting>(p.stateDir + "/fernreporting.db",
                                                  p.configDir + "/fernreporting.json", log)};
}

// The adapters that a reload or a stop reaches beyond the platform interfaces.
struct Adapters {
  Stores stores;
  std::shared_ptr<SXAsioDispatch> dispatch = std::make_shared<SXAsioDispatch>();
  std::shared_ptr<SXJsonDeviceProperties> device;
};

SXPlatform productionPlatform(const Options& options, const Adapters& adapters,
                              std::shared_ptr<SXLogFacility> log) {
  const SXPaths& p = options.paths;
  SXPlatform platform;
  platform.log = log;
  platform.tracer = std::make_shared<SXUsdtTracer>();
  platform.clock = std::make_shared<SXSystemClock>();
  platform.dispatch = adapters.dispatch;
  platform.random = std::make_shared<SXSystemRandom>();
  platform.process = std::make_shared<SXProcProcessInfo>();
  platform.device = adapters.device;
  platform.fileSystem = std::make_shared<SXPosixFileSystem>();
  platform.tallyvane = adapters.stores.tallyvane;
  platform.joulebook = adapters.stores.joulebook;
  platform.fernReporting = adapters.stores.fernReporting;
  platform.kestrel = std::make_shared<SXFileKestrel>(p.kestrelRoot, log);
  platform.orientation = std::make_shared<SXNoSensorOrientationService>();
  platform.preferences = std::make_shared<SXJsonPreferences>(p.preferencesDirectory(), log);
  platform.notifications = std::make_shared<SXInotifyNotifications>(p.runtimeDir, log);
  platform.diagnosticLogsDirectory = p.diagnosticLogsDir;
  return platform;
}

// The "otlp-http" backend as fernreporting.json describes it now. A reload that finds the file
// changed replaces the exporter; the spool's cursor carries the position over.
class Exporter {
 public:
  Exporter(const Options& options, const SXPlatform& platform, std::shared_ptr<SXLogFacility> log)
      : options_(options), platform_(platform), log_(std::move(log)) {}

  // I/O thread (or before it runs). Returns whether the exporter was replaced.
  bool reload() {
    std::string configPath = options_.paths.configDir + "/fernreporting.json";
    std::ifstream in(configPath);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (text == file_) return false;
    file_ = text;
    // The spool adapter has already logged whatever is wrong with the backends list.
    auto backends = SXSqliteFernReporting::loadBackends(configPath, nullptr);
    auto exportOptions = SXOtlpExportOptions::load(configPath, backends, *log_);
    std::shared_ptr<SXOtlpHttpExporter> next;
    if (exportOptions) {
      char host[256] = "";
      if (::gethostname(host, sizeof host - 1) == 0) exportOptions->resource.hostName = host;
      next = std::make_shared<SXOtlpHttpExporter>(
          options_.paths.stateDir + "/fernreporting.db", *exportOptions,
          std::make_shared<SXCurlHttpPost>(), platform_.clock, platform_.random, log_);
    }
    auto previous = current_.exchange(next);
    if (previous) previous->stop();
    if (next) next->start();
    return previous || next;
  }
  bool active() const { return current_.load() != nullptr; }
  uint64_t backlog() const {
    auto exporter = current_.load();
    return exporter ? exporter->backlog() : 0;
  }
  // Drain thread: lets the batch being posted be answered, then stops.
  void stopAfterPass() {
    if (auto exporter = current_.load()) exporter->stop(false);
  }

 private:
  const Options& options_;
  const SXPlatform& platform_;
  const std::shared_ptr<SXLogFacility> log_;
  std::string file_ = "\n(not read yet)";  // I/O thread: the file as last read
  std::atomic<std::shared_ptr<SXOtlpHttpExporter>> current_;
};

// Everything a stop or a reload reaches.
struct Service {
  const Options& options;
  Adapters& adapters;
  SXReportingEnvironment& environment;
  SXReportingServiceDelegate& delegate;
  SXUnixSocketListener& listener;
  Exporter& exporter;
  SXRetention& retention;
  SXReportingConfigFile& configFile;
};

void setStatusProviders(Service& s) {
  const Stores& stores = s.adapters.stores;
  SXUnixSocketListener& listener = s.listener;
  Exporter& exporter = s.exporter;
  s.delegate.setStatusProviders(
      {.requestsBackpressure = [&listener] { return listener.backpressurePauses(); },
       .tallyvaneWriteErrors = [t = stores.tallyvane] { return t->writeErrors(); },
       .joulebookWriteErrors = [j = stores.joulebook] { return j->writeErrors(); },
       .fernReportingWriteErrors = [f = stores.fernReporting] { return f->writeErrors(); },
       .spoolBacklog = exporter.active()
                           ? std::function<uint64_t()>([&exporter] { return exporter.backlog(); })
                           : std::function<uint64_t()>(),
       .partialFrames = [&listener] { return listener.partialFrameTimeouts(); },
       .inflightBytes = [&listener] { return listener.inflightBytes(); },
       .retentionCounters = [&retention = s.retention] { return retention.counters(); },
       .retentionGauges = [&retention = s.retention] { return retention.gauges(); }});
  s.retention.setSpoolExported(exporter.active());
}

// SIGHUP, on the I/O thread: each file keeps its old values when the new ones are bad.
void reload(Service& s) {
  const SXPaths& p = s.options.paths;
  SXLogFacility& log = s.environment.log();
  s.configFile.load();
  if (s.adapters.device->reload()) {
    SXLOG(log, nullptr, SXLogLevel::kDefault,
          "%@/device.json changed (InternalBuild is kept "
          "from the start)",
          p.configDir);
  }
  if (s.adapters.stores.fernReporting->reloadBackends()) {
    SXLOG(log, nullptr, SXLogLevel::kDefault, "backends for sessions started from now on: %@",
          SXValue(s.adapters.stores.fernReporting->backends()));
  }
  if (s.exporter.reload()) {
    SXLOG(log, nullptr, SXLogLevel::kDefault, "otlp-http export %@",
          s.exporter.active() ? "restarted with the new options" : "stopped");
    setStatusProviders(s);
  }
}

// Returns once the server queue has run everything queued before it and the pools stayed idle
// meanwhile: work that hands work on (server queue, session queues, back) has settled.
void waitUntilSettled(Service& s) {
  auto& queue = *s.environment.serverQueue();
  for (;;) {
    auto before = s.adapters.dispatch->activity();
    std::promise<void> marker;
    queue.async([&marker] { marker.set_value(); });
    marker.get_future().wait();
    auto after = s.adapters.dispatch->activity();
    if (before.busy == 0 && after.busy == 0 && before.begun == after.begun) return;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

// The stop drain, on a thread of its own while the I/O thread still writes replies. Returns
// what it drained.
std::string drain(Service& s) {
  uint64_t inflight = s.listener.inflightBytes();
  s.retention.stop();   // a pass gives way after its current chunk
  waitUntilSettled(s);  // the requests received have been handled and answered
  uint64_t sessions = s.environment.counters().sessionsLive();
  std::promise<size_t> closing;
  asio::post(s.listener.executor(), [&] { closing.set_value(s.listener.closeConnections()); });
  size_t connections = closing.get_future().get();
  waitUntilSettled(s);  // their sessions have stopped and their summaries are written
  s.adapters.stores.tallyvane->flush();
  s.adapters.stores.joulebook->flush();
  s.exporter.stopAfterPass();
  std::string drained =
      SXFormat("closed %zu connections and %llu sessions; stored the %llu payload bytes in flight",
               connections, static_cast<unsigned long long>(sessions),
               static_cast<unsigned long long>(inflight));
  if (uint64_t held = s.listener.inflightBytes()) {
    drained += SXFormat("; %llu payload bytes still waiting for a delay (alarm sends) are dropped",
                        static_cast<unsigned long long>(held));
  }
  if (s.exporter.active()) {
    drained += SXFormat("; %llu messages wait in the spool for the next export",
                        static_cast<unsigned long long>(s.exporter.backlog()));
  }
  return drained;
}

// Any thread: what a stop cut short leaves behind.
std::string leftovers(Service& s) {
  return SXFormat("%llu payload bytes in flight, %llu sessions live, %llu messages not exported",
                  static_cast<unsigned long long>(s.listener.inflightBytes()),
                  static_cast<unsigned long long>(s.environment.counters().sessionsLive()),
                  static_cast<unsigned long long>(s.exporter.backlog()));
}

void logLimits(SXLogFacility& log, const SXReportingLimits& l) {
  using ull = unsigned long long;
  SXLOG(log, nullptr, SXLogLevel::kDefault,
        "limits: %llu sessions per client, %llu sessions, %llu aggregate entries and %llu bytes "
        "per session, %llu aggregate bytes in all, %llu bytes of delayed standalone sends per "
        "client; payloads %llu, configurations %llu bytes, %llu reporter IDs per send; %llu "
        "queued requests, %llu reply bytes and %llu bytes in flight per connection, %llu in "
        "all; partial requests end after %llu ms",
        ull{l.maxSessionsPerClient}, ull{l.maxSessions}, ull{l.maxAggregateEntries},
        ull{l.maxAggregateBytes}, ull{l.maxAggregateBytesTotal}, ull{l.maxPendingStandaloneBytes},
        ull{l.maxPayloadBytes}, ull{l.maxConfigurationBytes}, ull{l.maxReporterIDs},
        ull{l.maxQueuedRequests}, ull{l.maxPendingReplyBytes}, ull{l.maxConnectionBytes},
        ull{l.maxInflightBytes}, ull{l.partialFrameTimeoutMs});
}

SXUnixSocketListener::Options listenerOptions(const Options& options,
                                              const SXReportingEnvironment& environment) {
  const SXReportingLimits l = environment.limits();
  RpcLimits limits;
  limits.maxMessageBytes = options.maxMessageBytes;
  // Requests are handed to the server queue, so that queue tells when they have been handled.
  return {.socketPath = options.paths.socketPath,
          .socketMode = options.socketMode,
          .limits = limits,
          .maxQueuedRequests = l.maxQueuedRequests,
          .maxPendingReplyBytes = l.maxPendingReplyBytes,
          .maxConnectionBytes = l.maxConnectionBytes,
          .maxInflightBytes = l.maxInflightBytes,
          .partialFrameTimeout = std::chrono::milliseconds(l.partialFrameTimeoutMs),
          .requestQueue = environment.serverQueue()};
}

// Serves until a stop has drained; returns the exit status.
int serve(Service& s) {
  SXLogFacility& log = s.environment.log();
  if (SXStatus opened = s.listener.open(); !opened.ok()) {
    SXLOG(log, nullptr, SXLogLevel::kError, "cannot listen: %@", opened.error());
    return 1;
  }
  s.listener.setDelegate(s.delegate.shared_from_this());
  logLimits(log, s.environment.limits());
  const std::string& socket = s.options.paths.socketPath;
  SXLOG(log, nullptr, SXLogLevel::kDefault,
        "sxreportingd %i ready, listening on %@%@ (talk to it with: sxreportctl --socket %@ "
        "status)",
        s.environment.platform().process->processIdentifier(), socket,
        s.listener.socketActivated() ? " (socket activated)" : "", socket);
  SXServiceManager manager;
  SXReportingLifecycle lifecycle(
      s.listener.executor(),
      {.stopReading = [&s] { s.listener.stopReading(); },
       .drain = [&s] { return drain(s); },
       .leftovers = [&s] { return leftovers(s); },
       .reload = [&s] { reload(s); },
       .throughServerQueue = [q = s.environment.serverQueue()](
                                 std::function<void()> task) { q->async(std::move(task)); },
       .finish = [&s] { s.listener.stop(); }},
      manager, std::chrono::milliseconds(s.options.drainTimeoutMs), s.environment.platform().log);
  lifecycle.start();
  if (s.exporter.reload()) setStatusProviders(s);
  s.retention.start();
  manager.ready("serving on " + socket);
  s.listener.resume();
  return lifecycle.exitStatus();
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (auto status = parseOptions(argc, argv, options)) return *status;

  // Stores, preferences and notification files hold client payloads: no access for others.
  ::umask(0027);
  auto log = std::make_shared<SXStderrLog>(options.logScopes);
  // Whichever way main ends, the lines still waiting for the log's writer go out first.
  struct FlushLog {
    SXStderrLog& log;
    ~FlushLog() { log.flush(); }
  } flushLog{*log};
  SXPosixFileSystem fs;
  // The runtime directory has the group of the socket the daemon binds in it, so 0750 still
  // lets that group reach the socket and the notify directory.
  for (const auto& dir :
       {options.paths.stateDir, options.paths.configDir, options.paths.runtimeDir}) {
    if (SXStatus made = fs.createDirectory(dir, 0750); !made.ok()) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "cannot create %@: %@", dir, made.error());
      return 1;
    }
  }

  Adapters adapters{
      .stores = openStores(options.paths, log),
      .device = std::make_shared<SXJsonDeviceProperties>(options.paths.configDir + "/device.json")};
  auto environment = std::make_shared<SXReportingEnvironment>(
      productionPlatform(options, adapters, log), options.limits);
  SXReportingConfigFile configFile(options.paths.configDir + "/sxreportingd.json", log);
  SXReportingLimitsSection limits(environment, options.fixedLimits);
  configFile.addSection([&limits](const SXValue& file) { return limits.read(file); });
  auto retention = SXRetention::create({.stateDir = options.paths.stateDir,
                                        .diagnosticLogsDir = options.paths.diagnosticLogsDir,
                                        .dispatch = environment->platform().dispatch,
                                        .log = log},
                                       SXRetentionPolicy());
  configFile.addSection([&retention, &configFile, &log](const SXValue& file) {
    auto policy = SXRetentionPolicy::fromConfigFile(file);
    if (!policy.ok()) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "%@: %@; keeping the retention as it was",
            configFile.path(), policy.error());
      return false;
    }
    SXLOG(*log, nullptr, SXLogLevel::kDefault, "retention: %@", policy->description());
    retention->setPolicy(*policy);
    return true;
  });
  if (!configFile.load()) {
    SXLOG(*log, nullptr, SXLogLevel::kError, "cannot start: %@ is not valid (see above)",
          configFile.path());
    return 2;
  }
  auto delegate = SXReportingServiceDelegate::init(environment);
  Exporter exporter(options, environment->platform(), log);
  SXUnixSocketListener listener(listenerOptions(options, *environment), log);
  Service service{options,  adapters, *environment, *delegate,
                  listener, exporter, *retention,   configFile};
  setStatusProviders(service);
  int status = serve(service);
  // After a drain everything is stored; tearing down the object graph would only repeat it.
  log->flush();
  std::fflush(nullptr);
  std::_Exit(status);
}
