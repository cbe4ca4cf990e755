// sxreportingd: the reporting service of the audio stack.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "SXReportingServiceDelegate.h"
#include "common/SXPaths.h"
#include "platform/AsioDispatch.h"
#include "platform/FileKestrel.h"
#include "platform/InotifyNotifications.h"
#include "platform/JsonPreferences.h"
#include "platform/OtlpHttpExporter.h"
#include "platform/Retention.h"
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
    "\n"
    "With no options and not root, everything lives under ./var of the working directory.\n";

struct Options {
  SXPaths paths = SXPaths::fromEnvironment();
  std::string logScopes;
  size_t maxMessageBytes = 1 << 20;
  unsigned socketMode = 0660;
  SXReportingLimits limits;
};

struct LimitFlag {
  const char* flag;
  const char* environment;
  uint64_t SXReportingLimits::*member;
};

constexpr LimitFlag kLimitFlags[] = {
    {"--max-sessions-per-client", "SXREPORTING_MAX_SESSIONS_PER_CLIENT",
     &SXReportingLimits::maxSessionsPerClient},
    {"--max-sessions", "SXREPORTING_MAX_SESSIONS", &SXReportingLimits::maxSessions},
    {"--max-aggregate-entries", "SXREPORTING_MAX_AGGREGATE_ENTRIES",
     &SXReportingLimits::maxAggregateEntries},
    {"--max-aggregate-bytes", "SXREPORTING_MAX_AGGREGATE_BYTES",
     &SXReportingLimits::maxAggregateBytes},
    {"--max-aggregate-bytes-total", "SXREPORTING_MAX_AGGREGATE_BYTES_TOTAL",
     &SXReportingLimits::maxAggregateBytesTotal},
    {"--max-pending-standalone-bytes", "SXREPORTING_MAX_PENDING_STANDALONE_BYTES",
     &SXReportingLimits::maxPendingStandaloneBytes},
    {"--max-payload-bytes", "SXREPORTING_MAX_PAYLOAD_BYTES", &SXReportingLimits::maxPayloadBytes},
    {"--max-configuration-bytes", "SXREPORTING_MAX_CONFIGURATION_BYTES",
     &SXReportingLimits::maxConfigurationBytes},
    {"--max-reporter-ids", "SXREPORTING_MAX_REPORTER_IDS", &SXReportingLimits::maxReporterIDs},
    {"--max-connection-bytes", "SXREPORTING_MAX_CONNECTION_BYTES",
     &SXReportingLimits::maxConnectionBytes},
    {"--max-inflight-bytes", "SXREPORTING_MAX_INFLIGHT_BYTES",
     &SXReportingLimits::maxInflightBytes},
    {"--partial-frame-timeout-ms", "SXREPORTING_PARTIAL_FRAME_TIMEOUT_MS",
     &SXReportingLimits::partialFrameTimeoutMs},
    {"--max-error-lines", "SXREPORTING_MAX_ERROR_LINES", &SXReportingLimits::maxErrorLines},
    {"--max-connections-per-client", "SXREPORTING_MAX_CONNECTIONS_PER_CLIENT",
     &SXReportingLimits::maxConnectionsPerClient},
    {"--max-queued-requests", "SXREPORTING_MAX_QUEUED_REQUESTS",
     &SXReportingLimits::maxQueuedRequests},
    {"--max-pending-reply-bytes", "SXREPORTING_MAX_PENDING_REPLY_BYTES",
     &SXReportingLimits::maxPendingReplyBytes},
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

// The limits from their environment variables; false (and a message) when one is malformed.
bool limitsFromEnvironment(SXReportingLimits& limits) {
  for (const auto& limit : kLimitFlags) {
    const char* text = envOr(limit.environment, nullptr);
    if (text && !parsePositive(text, limits.*limit.member)) {
      std::fprintf(stderr, "sxreportingd: bad %s '%s' (expected a positive number)\n",
                   limit.environment, text);
      return false;
    }
  }
  return true;
}

// Whether `arg` names a limit; `ok` says whether its value was good.
bool parseLimitFlag(const std::string& arg, const char* value, SXReportingLimits& limits,
                    bool& ok) {
  for (const auto& limit : kLimitFlags) {
    if (arg != limit.flag) continue;
    ok = parsePositive(value, limits.*limit.member);
    return true;
  }
  return false;
}

// Returns 0 to go on, or the exit status.
int parseOptions(int argc, char** argv, Options& options) {
  if (!limitsFromEnvironment(options.limits)) return 2;
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
    if (i + 1 >= argc) {
      std::fprintf(stderr, "sxreportingd: %s needs a value\n%s", arg.c_str(), kUsage);
      return 2;
    }
    const char* value = argv[++i];
    SXPaths& p = options.paths;
    bool limitOk = false;
    if (parseLimitFlag(arg, value, options.limits, limitOk)) {
      if (limitOk) continue;
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

SXPlatform productionPlatform(const Options& options, const Stores& stores,
                              std::shared_ptr<SXLogFacility> log) {
  const SXPaths& p = options.paths;
  SXPlatform platform;
  platform.log = log;
  platform.tracer = std::make_shared<SXUsdtTracer>();
  platform.clock = std::make_shared<SXSystemClock>();
  platform.dispatch = std::make_shared<SXAsioDispatch>();
  platform.random = std::make_shared<SXSystemRandom>();
  platform.process = std::make_shared<SXProcProcessInfo>();
  platform.device = std::make_shared<SXJsonDeviceProperties>(p.configDir + "/device.json");
  platform.fileSystem = std::make_shared<SXPosixFileSystem>();
  platform.tallyvane = stores.tallyvane;
  platform.joulebook = stores.joulebook;
  platform.fernReporting = stores.fernReporting;
  platform.kestrel = std::make_shared<SXFileKestrel>(p.kestrelRoot, log);
  platform.orientation = std::make_shared<SXNoSensorOrientationService>();
  platform.preferences = std::make_shared<SXJsonPreferences>(p.configDir, log);
  platform.notifications = std::make_shared<SXInotifyNotifications>(p.runtimeDir, log);
  platform.diagnosticLogsDirectory = p.diagnosticLogsDir;
  return platform;
}

// The "otlp-http" backend, when fernreporting.json lists it; it reads the spool's database.
std::unique_ptr<SXOtlpHttpExporter> otlpExporter(const Options& options, const SXPlatform& platform,
                                                 const std::shared_ptr<SXLogFacility>& log) {
  const SXPaths& p = options.paths;
  std::string configPath = p.configDir + "/fernreporting.json";
  // The spool adapter has already logged whatever is wrong with the backends list.
  auto backends = SXSqliteFernReporting::loadBackends(configPath, nullptr);
  auto exportOptions = SXOtlpExportOptions::load(configPath, backends, *log);
  if (!exportOptions) return nullptr;
  char host[256] = "";
  if (::gethostname(host, sizeof host - 1) == 0) exportOptions->resource.hostName = host;
  return std::make_unique<SXOtlpHttpExporter>(p.stateDir + "/fernreporting.db", *exportOptions,
                                              std::make_shared<SXCurlHttpPost>(), platform.clock,
                                              platform.random, log);
}

// Retention of the stores and files, from the "retention" section of sxreportingd.json.
std::shared_ptr<SXRetention> retentionRunner(const Options& options, const SXPlatform& platform,
                                             bool spoolExported,
                                             const std::shared_ptr<SXLogFacility>& log) {
  const SXPaths& p = options.paths;
  auto policy = SXRetentionPolicy::load(p.configDir + "/sxreportingd.json", *log);
  SXLOG(*log, nullptr, SXLogLevel::kDefault, "retention: %s", policy.description());
  return SXRetention::create({.stateDir = p.stateDir,
                              .diagnosticLogsDir = p.diagnosticLogsDir,
                              .spoolExported = spoolExported,
                              .dispatch = platform.dispatch,
                              .log = log},
                             policy);
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (int status = parseOptions(argc, argv, options)) return status < 0 ? 0 : status;

  // Stores, preferences and notification files hold client payloads: no access for others.
  ::umask(0027);
  auto log = std::make_shared<SXStderrLog>(options.logScopes);
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

  Stores stores = openStores(options.paths, log);
  auto environment = std::make_shared<SXReportingEnvironment>(
      productionPlatform(options, stores, log), options.limits);
  auto delegate = SXReportingServiceDelegate::init(environment);
  std::shared_ptr<SXOtlpHttpExporter> exporter =
      otlpExporter(options, environment->platform(), log);
  auto retainer = retentionRunner(options, environment->platform(), exporter != nullptr, log);
  RpcLimits limits;
  limits.maxMessageBytes = options.maxMessageBytes;
  // Requests are handed to the server queue, so that queue tells when they have been handled.
  SXUnixSocketListener listener(
      {.socketPath = options.paths.socketPath,
       .socketMode = options.socketMode,
       .limits = limits,
       .maxQueuedRequests = options.limits.maxQueuedRequests,
       .maxPendingReplyBytes = options.limits.maxPendingReplyBytes,
       .maxConnectionBytes = options.limits.maxConnectionBytes,
       .maxInflightBytes = options.limits.maxInflightBytes,
       .partialFrameTimeout = std::chrono::milliseconds(options.limits.partialFrameTimeoutMs),
       .requestQueue = environment->serverQueue()},
      log);
  delegate->setStatusProviders(
      {.requestsBackpressure = [&listener] { return listener.backpressurePauses(); },
       .tallyvaneWriteErrors = [t = stores.tallyvane] { return t->writeErrors(); },
       .joulebookWriteErrors = [j = stores.joulebook] { return j->writeErrors(); },
       .fernReportingWriteErrors = [f = stores.fernReporting] { return f->writeErrors(); },
       .spoolBacklog = exporter
                           ? std::function<uint64_t()>([exporter] { return exporter->backlog(); })
                           : std::function<uint64_t()>(),
       .partialFrames = [&listener] { return listener.partialFrameTimeouts(); },
       .inflightBytes = [&listener] { return listener.inflightBytes(); },
       .retentionCounters = [retainer] { return retainer->counters(); },
       .retentionGauges = [retainer] { return retainer->gauges(); }});

  std::string error;
  if (!listener.open(error)) {
    SXLOG(*log, nullptr, SXLogLevel::kError, "cannot listen: %@", error);
    return 1;
  }
  listener.setDelegate(delegate);
  const SXReportingLimits& l = options.limits;
  using ull = unsigned long long;
  SXLOG(*log, nullptr, SXLogLevel::kDefault,
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
  SXLOG(
      *log, nullptr, SXLogLevel::kDefault,
      "sxreportingd %i ready, listening on %@%@ (talk to it with: sxreportctl --socket %@ status)",
      environment->platform().process->processIdentifier(), options.paths.socketPath,
      listener.socketActivated() ? " (socket activated)" : "", options.paths.socketPath);
  if (exporter) exporter->start();
  retainer->start();
  listener.resume();
  retainer->stop();
  if (exporter) exporter->stop();
  return 0;
}
