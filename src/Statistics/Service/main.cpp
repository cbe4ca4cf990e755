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

#include "SXReportingDaemonConfig.h"
#include "SXReportingLifecycle.h"
#include "SXReportingServiceDelegate.h"
#include "SXVersion.h"
#include "common/SXPaths.h"
#include "platform/AsioDispatch.h"
#include "platform/FileKestrel.h"
#include "platform/InotifyNotifications.h"
#include "platform/JsonPreferences.h"
#include "platform/OtlpHttpExporter.h"
#include "platform/Retention.h"
#include "platform/ServiceManager.h"
#include "platform/SqliteFernReporting.h"
#include "platform/SqliteJoulebook.h"
#include "platform/SqliteTallyvane.h"
#include "platform/StderrLog.h"
#include "platform/UnixSocketIpc.h"

#ifdef SXR_JEMALLOC
// jemalloc's options, read when it starts: two arenas for our two cores, and freed pages
// handed back to the system within a second of a burst rather than ten.
extern "C" const char* malloc_conf;
const char* malloc_conf = "narenas:2,dirty_decay_ms:1000,muzzy_decay_ms:0";
#endif

namespace {

constexpr const char* kUsage =
    "Usage: sxreportingd [options]\n"
    "\n"
    "The reporting service of the audio stack. Clients connect over a Unix socket and speak\n"
    "MessagePack-RPC (see sxreportctl(1) and docs/protocol.md).\n"
    "\n"
    "Each option can also be set by the environment variable named in parentheses.\n"
    "\n"
    "Options:\n"
    "  --socket PATH               socket path (SXREPORTING_SOCKET)\n"
    "                              default "
    "<runtime-dir>/com.vendra.audio.kitbench.reporting.service\n"
    "  --state-dir DIR             analytics, power-log and spool databases "
    "(SXREPORTING_STATE_DIR)\n"
    "  --config-dir DIR            device.json, fernreporting.json, preferences/ "
    "(SXREPORTING_CONFIG_DIR)\n"
    "  --runtime-dir DIR           socket and notify/ directory (SXREPORTING_RUNTIME_DIR)\n"
    "  --preferences-dir DIR       preferences domains (SXREPORTING_PREFERENCES_DIR,\n"
    "                              default <config-dir>/preferences;\n"
    "                              as root <state-dir>/preferences)\n"
    "  --diagnostic-logs-dir DIR   session summary files of internal builds\n"
    "                              (SXREPORTING_DIAGNOSTIC_LOGS_DIR)\n"
    "  --kestrel-root DIR          driver counters (SXREPORTING_KESTREL_ROOT)\n"
    "  --log-scope SCOPE=LEVEL,...\n"
    "                              enable verbose lines, e.g. sxrs=5,sxrr=5,sxrd=5\n"
    "                              (SXREPORTING_LOG_SCOPES)\n"
    "  --max-message-bytes N       largest request accepted (SXREPORTING_MAX_MESSAGE_BYTES,\n"
    "                              default 1048576)\n"
    "  --socket-mode MODE          permissions of the socket, octal (SXREPORTING_SOCKET_MODE,\n"
    "                              default 0660)\n"
    "\n"
    "limits (a positive number each; what they refuse is logged and counted in `status`):\n"
    "  --max-sessions-per-client N live sessions of one client; a create beyond it makes\n"
    "                              nothing (SXREPORTING_MAX_SESSIONS_PER_CLIENT, default 4096)\n"
    "  --max-sessions N            live sessions of all clients (SXREPORTING_MAX_SESSIONS,\n"
    "                              default 65536)\n"
    "  --max-aggregate-entries N   entries a session gathers for its summary; later messages\n"
    "                              are sent but left out of it "
    "(SXREPORTING_MAX_AGGREGATE_ENTRIES,\n"
    "                              default 100000)\n"
    "  --max-aggregate-bytes N     the same in bytes (texts and 256 an entry), per session\n"
    "                              (SXREPORTING_MAX_AGGREGATE_BYTES, default 1048576)\n"
    "  --max-aggregate-bytes-total N\n"
    "                              the same for all sessions together\n"
    "                              (SXREPORTING_MAX_AGGREGATE_BYTES_TOTAL, default 8388608)\n"
    "  --max-pending-standalone-bytes N\n"
    "                              payload bytes of one client's standalone sends waiting for\n"
    "                              their delay; further ones are refused\n"
    "                              (SXREPORTING_MAX_PENDING_STANDALONE_BYTES, default 1048576)\n"
    "  --max-payload-bytes N       a message's payload, MessagePack bytes; larger ones get an\n"
    "                              error reply (SXREPORTING_MAX_PAYLOAD_BYTES, default 65536)\n"
    "  --max-configuration-bytes N a session's configuration, likewise\n"
    "                              (SXREPORTING_MAX_CONFIGURATION_BYTES, default 65536)\n"
    "  --max-reporter-ids N        reporter IDs in one send's list, likewise\n"
    "                              (SXREPORTING_MAX_REPORTER_IDS, default 1024)\n"
    "  --max-queued-requests N     requests of one connection read but not yet handled before\n"
    "                              the daemon stops reading it (SXREPORTING_MAX_QUEUED_REQUESTS,\n"
    "                              default 1024)\n"
    "  --max-pending-reply-bytes N replies of one connection waiting to be written before the\n"
    "                              daemon stops reading it (SXREPORTING_MAX_PENDING_REPLY_BYTES,\n"
    "                              default 4194304)\n"
    "  --max-connection-bytes N    bytes one connection may make the daemon hold (requests and\n"
    "                              payloads not yet stored) before it stops reading it\n"
    "                              (SXREPORTING_MAX_CONNECTION_BYTES, default 1048576)\n"
    "  --max-inflight-bytes N      the same for all connections together; beyond it the\n"
    "                              connections holding the most stop being read\n"
    "                              (SXREPORTING_MAX_INFLIGHT_BYTES, default 8388608)\n"
    "  --partial-frame-timeout-ms N\n"
    "                              time a request that has begun to arrive may take to complete;\n"
    "                              then its connection ends "
    "(SXREPORTING_PARTIAL_FRAME_TIMEOUT_MS,\n"
    "                              default 30000)\n"
    "  --max-error-lines N         error lines one client may cause a minute; the rest are\n"
    "                              counted in one line (SXREPORTING_MAX_ERROR_LINES, default 20)\n"
    "  --max-connections-per-client N\n"
    "                              open connections of one process; further ones are closed\n"
    "                              at once (SXREPORTING_MAX_CONNECTIONS_PER_CLIENT, default 128)\n"
    "  -h, --help                  this text\n"
    "  --version                   print the version\n"
    "\n"
    "lifecycle:\n"
    "  --drain-timeout-ms N        how long a stop (SIGTERM, SIGINT) may drain before the\n"
    "                              daemon exits with what is left (SXREPORTING_DRAIN_TIMEOUT_MS,\n"
    "                              default 10000)\n"
    "\n"
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
    "With no options and not root, everything lives under ./var of the working directory.\n";

struct Options {
  SXPaths paths = SXPaths::fromEnvironment();
  std::string logScopes;
  size_t maxMessageBytes = 1 << 20;
  unsigned socketMode = 0660;
  SXReportingLimits limits;
  // Limits given as options or environment variables: the configuration file cannot change them.
  std::set<std::string> fixedLimits;
  std::chrono::milliseconds drainTimeout{10'000};
};

const char* envOr(const char* name, const char* fallback) {
  const char* value = std::getenv(name);
  return value && *value ? value : fallback;
}

bool parseNumber(const char* text, unsigned long long& out, int base) {
  char* end = nullptr;
  errno = 0;
  out = std::strtoull(text, &end, base);
  return errno == 0 && end && *end == '\0' && end != text;
}

bool parsePositive(const char* text, uint64_t& out) {
  unsigned long long number = 0;
  if (!parseNumber(text, number, 10) || number == 0) return false;
  out = number;
  return true;
}

// The limits and the drain timeout from their environment variables; false (and a message)
// when one is malformed.
bool lifecycleFromEnvironment(Options& options) {
  for (const auto& limit : SXReportingLimitOptions()) {
    const char* text = envOr(limit.environment, nullptr);
    if (!text) continue;
    if (!parsePositive(text, options.limits.*limit.member)) {
      std::fprintf(stderr, "sxreportingd: bad %s '%s' (expected a positive number)\n",
                   limit.environment, text);
      return false;
    }
    options.fixedLimits.insert(limit.name);
  }
  uint64_t ms = 0;
  const char* drain = envOr("SXREPORTING_DRAIN_TIMEOUT_MS", nullptr);
  if (drain && !parsePositive(drain, ms)) {
    std::fprintf(stderr, "sxreportingd: bad SXREPORTING_DRAIN_TIMEOUT_MS '%s'\n", drain);
    return false;
  }
  if (drain) options.drainTimeout = std::chrono::milliseconds(ms);
  return true;
}

// Whether `arg` names a limit or the drain timeout; `ok` says whether its value was good.
bool parseLifecycleFlag(const std::string& arg, const char* value, Options& options, bool& ok) {
  if (arg == "--drain-timeout-ms") {
    uint64_t ms = 0;
    ok = parsePositive(value, ms);
    options.drainTimeout = std::chrono::milliseconds(ms);
    return true;
  }
  for (const auto& limit : SXReportingLimitOptions()) {
    if (arg != std::string("--") + limit.name) continue;
    ok = parsePositive(value, options.limits.*limit.member);
    options.fixedLimits.insert(limit.name);
    return true;
  }
  return false;
}

// Returns 0 to go on, or the exit status.
int parseOptions(int argc, char** argv, Options& options) {
  if (!lifecycleFromEnvironment(options)) return 2;
  options.logScopes = envOr("SXREPORTING_LOG_SCOPES", "");
  unsigned long long number = 0;
  if (parseNumber(envOr("SXREPORTING_MAX_MESSAGE_BYTES", "1048576"), number, 10)) {
    options.maxMessageBytes = number;
  }
  if (parseNumber(envOr("SXREPORTING_SOCKET_MODE", "0660"), number, 8)) {
    options.socketMode = static_cast<unsigned>(number);
  }
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "-h" || arg == "--help") {
      std::fputs(kUsage, stdout);
      return -1;
    }
    if (arg == "--version") {
      std::printf("sxreportingd %s\n", kSXVersion);
      return -1;
    }
    if (i + 1 >= argc) {
      std::fprintf(stderr, "sxreportingd: %s needs a value\n%s", arg.c_str(), kUsage);
      return 2;
    }
    const char* value = argv[++i];
    SXPaths& p = options.paths;
    bool lifecycleOk = false;
    if (parseLifecycleFlag(arg, value, options, lifecycleOk)) {
      if (lifecycleOk) continue;
      std::fprintf(stderr, "sxreportingd: bad option %s %s (expected a positive number)\n",
                   arg.c_str(), value);
      return 2;
    }
    if (arg == "--socket") {
      p.socketPath = value;
      p.socketPathExplicit = true;
    } else if (arg == "--state-dir") {
      p.stateDir = value;
    } else if (arg == "--config-dir") {
      p.configDir = value;
    } else if (arg == "--runtime-dir") {
      p.runtimeDir = value;
      p.runtimeDirChanged();
    } else if (arg == "--preferences-dir") {
      p.preferencesDir = value;
    } else if (arg == "--diagnostic-logs-dir") {
      p.diagnosticLogsDir = value;
    } else if (arg == "--kestrel-root") {
      p.kestrelRoot = value;
    } else if (arg == "--log-scope") {
      options.logScopes = value;
    } else if (arg == "--max-message-bytes" && parseNumber(value, number, 10) && number > 0) {
      options.maxMessageBytes = number;
    } else if (arg == "--socket-mode" && parseNumber(value, number, 8) && number <= 0777) {
      options.socketMode = static_cast<unsigned>(number);
    } else {
      std::fprintf(stderr, "sxreportingd: bad option %s %s\n%s", arg.c_str(), value, kUsage);
      return 2;
    }
  }
  std::map<std::string, int> levels;
  if (!SXStderrLog::parseLevels(options.logScopes, levels)) {
    std::fprintf(stderr, "sxreportingd: bad --log-scope '%s' (expected SCOPE=LEVEL,...)\n",
                 options.logScopes.c_str());
    return 2;
  }
  return 0;
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
    SXLOG(log, nullptr, SXLogLevel::kDefault, "%@/device.json changed (InternalBuild is kept "
          "from the start)", p.configDir);
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
  s.retention.stop();  // a pass gives way after its current chunk
  waitUntilSettled(s);  // the requests received have been handled and answered
  uint64_t sessions = s.environment.counters().sessionsLive();
  std::promise<size_t> closing;
  asio::post(s.listener.executor(),
             [&] { closing.set_value(s.listener.closeConnections()); });
  size_t connections = closing.get_future().get();
  waitUntilSettled(s);  // their sessions have stopped and their summaries are written
  s.adapters.stores.tallyvane->flush();
  s.adapters.stores.joulebook->flush();
  s.exporter.stopAfterPass();
  std::string drained = SXFormat(
      "closed %zu connections and %llu sessions; stored the %llu payload bytes in flight",
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
      manager, s.options.drainTimeout, s.environment.platform().log);
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
  if (int status = parseOptions(argc, argv, options)) return status < 0 ? 0 : status;

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
    if (auto error = fs.createDirectory(dir, 0750)) {
      SXLOG(*log, nullptr, SXLogLevel::kError, "cannot create %@: %@", dir, *error);
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
                  listener, exporter, *retention, configFile};
  setStatusProviders(service);
  int status = serve(service);
  // After a drain everything is stored; tearing down the object graph would only repeat it.
  log->flush();
  std::fflush(nullptr);
  std::_Exit(status);
}
