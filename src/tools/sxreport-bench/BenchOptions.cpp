#include "BenchOptions.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <sstream>

#include "SXVersion.h"
#include "common/SXPaths.h"

namespace {

constexpr const char* kUsage =
    "usage: sxreport-bench [options]\n"
    "\n"
    "Drives sxreportingd with N client connections and reports messages per second, reply\n"
    "latency (p50/p99/max), daemon CPU seconds per million messages, daemon peak RSS and, for\n"
    "the message scenarios, the rows that reached tallyvane.db and fernreporting.db. With\n"
    "--baseline it runs the same clients against a MessagePack-RPC echo server and prints the\n"
    "ratio daemon / baseline. Exit status 0 when every reply came and every row landed.\n"
    "\n"
    "target:\n"
    "  --spawn                start a daemon for each scenario on a temporary socket and\n"
    "                         state directory\n"
    "  --daemon PATH          the daemon to spawn (default: sxreportingd beside this program)\n"
    "  --keep                 keep the spawned daemons' directories (and their logs)\n"
    "  --daemon-flag NAME=VALUE\n"
    "                         pass '--NAME VALUE' to every spawned daemon (repeatable)\n"
    "  --socket PATH          a running daemon (default: the service's socket, as sxreportctl)\n"
    "  --state-dir DIR        that daemon's state directory, for the row counts\n"
    "  --baseline             also run every scenario against the echo server\n"
    "\n"
    "scenarios (--scenario NAME[,NAME...], or all; default addressed):\n"
    "  addressed   pipelined sends to each client's own started session\n"
    "  broadcast   pipelined sends to every started session (each lands once per client)\n"
    "  standalone  sends to each client's own session, created but not started (telephony,\n"
    "              so no random delay), which go to the spool as single messages\n"
    "  lifecycle   loops of create / start / send x10 / stop / destroy\n"
    "  rpc         ping-pong reporterID:valid: (window 1)\n"
    "  idle        daemon RSS idle, after creating the sessions, and after they are gone\n"
    "  abuse       (not in all) hostile clients, one attack after another, then all at once,\n"
    "              while a well-behaved one times reporterID:valid:; checks the daemon's peak\n"
    "              RSS, that latency and its log size against targets (exit 0 when missed)\n"
    "\n"
    "load:\n"
    "  --clients N            client connections (default 4)\n"
    "  --messages N           messages per client (default 20000; lifecycle: N/10 loops)\n"
    "  --sessions N           sessions per client, the active one included; the others are\n"
    "                         created and left idle (default 1)\n"
    "  --window N             requests in flight per client (default 32)\n"
    "  --stop-every N         addressed: stop and restart the session every N messages\n"
    "                         (default never)\n"
    "  --rss-samples N        daemon RSS samples during the run (default 10)\n"
    "  --drain-timeout S      give up on missing rows after S seconds without a new one (60)\n"
    "  --reply-timeout S      give up after S seconds without any reply (30)\n"
    "  --attack-seconds S     abuse: how long each attack runs (default 4)\n"
    "  --partial-connections N\n"
    "                         abuse: connections left mid-request (default 1000)\n"
    "\n"
    "output:\n"
    "  --json                 one JSON object on stdout\n"
    "  -h, --help             this text\n"
    "  --version              print the version\n";

bool parseCount(const char* text, uint64_t& out) {
  char* end = nullptr;
  errno = 0;
  unsigned long long value = std::strtoull(text, &end, 10);
  if (errno != 0 || end == text || *end != '\0' || text[0] == '-') return false;
  out = value;
  return true;
}

bool parseSeconds(const char* text, double& out) {
  char* end = nullptr;
  errno = 0;
  out = std::strtod(text, &end);
  return errno == 0 && end != text && *end == '\0' && out > 0;
}

// "NAME=VALUE" or "--NAME=VALUE".
bool parseDaemonFlag(const std::string& text, std::vector<DaemonFlag>& out) {
  size_t equals = text.find('=');
  if (equals == std::string::npos || equals == 0) return false;
  std::string name = text.substr(0, equals);
  if (name.rfind("--", 0) != 0) name = "--" + name;
  if (name.size() <= 2) return false;
  out.push_back({name, text.substr(equals + 1), false});
  return true;
}

bool parseScenarios(const std::string& text, std::vector<ScenarioKind>& out) {
  // abuse stays out of "all": it checks robustness against targets of its own rather than
  // measuring speed, and takes about half a minute.
  const std::vector<ScenarioKind> all = {ScenarioKind::kAddressed,  ScenarioKind::kBroadcast,
                                         ScenarioKind::kStandalone, ScenarioKind::kLifecycle,
                                         ScenarioKind::kRpc,        ScenarioKind::kIdle};
  std::vector<ScenarioKind> names = all;
  names.push_back(ScenarioKind::kAbuse);
  out.clear();
  std::stringstream list(text);
  std::string name;
  while (std::getline(list, name, ',')) {
    if (name == "all") {
      out.insert(out.end(), all.begin(), all.end());
      continue;
    }
    bool known = false;
    for (ScenarioKind kind : names) {
      if (name == ScenarioName(kind)) {
        out.push_back(kind);
        known = true;
      }
    }
    if (!known) return false;
  }
  return !out.empty();
}

int usageError(const std::string& what) {
  std::fprintf(stderr, "sxreport-bench: %s\n(see sxreport-bench --help)\n", what.c_str());
  return 2;
}

// Applies one option that takes a value. Returns false when the value is bad.
bool applyValue(const std::string& arg, const char* value, BenchOptions& options) {
  uint64_t count = 0;
  if (arg == "--socket") {
    options.socketPath = value;
  } else if (arg == "--state-dir") {
    options.stateDir = value;
  } else if (arg == "--daemon") {
    options.daemonPath = value;
  } else if (arg == "--scenario") {
    return parseScenarios(value, options.scenarios);
  } else if (arg == "--drain-timeout") {
    return parseSeconds(value, options.drainTimeoutSeconds);
  } else if (arg == "--reply-timeout") {
    return parseSeconds(value, options.replyTimeoutSeconds);
  } else if (arg == "--attack-seconds") {
    return parseSeconds(value, options.attackSeconds) && options.attackSeconds <= 3600;
  } else if (arg == "--daemon-flag") {
    return parseDaemonFlag(value, options.daemonFlags);
  } else if (!parseCount(value, count)) {
    return false;
  } else if (arg == "--clients" && count >= 1 && count <= 4096) {
    options.clients = count;
  } else if (arg == "--messages" && count >= 1) {
    options.messages = count;
  } else if (arg == "--sessions" && count >= 1 && count < (1u << 24)) {
    options.sessions = count;
  } else if (arg == "--window" && count >= 1 && count <= 65536) {
    options.window = count;
  } else if (arg == "--stop-every") {
    options.stopEvery = count;
  } else if (arg == "--rss-samples" && count >= 1 && count <= 10000) {
    options.rssSamples = count;
  } else if (arg == "--partial-connections" && count <= 100'000) {
    options.partialConnections = count;
  } else {
    return false;
  }
  return true;
}

}  // namespace

const char* ScenarioName(ScenarioKind kind) {
  switch (kind) {
    case ScenarioKind::kAddressed:
      return "addressed";
    case ScenarioKind::kBroadcast:
      return "broadcast";
    case ScenarioKind::kStandalone:
      return "standalone";
    case ScenarioKind::kLifecycle:
      return "lifecycle";
    case ScenarioKind::kRpc:
      return "rpc";
    case ScenarioKind::kIdle:
      return "idle";
    case ScenarioKind::kAbuse:
      return "abuse";
  }
  return "?";
}

int ParseBenchOptions(int argc, char** argv, BenchOptions& options) {
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "-h" || arg == "--help") {
      std::fputs(kUsage, stdout);
      return 0;
    }
    if (arg == "--version") {
      std::printf("sxreport-bench %s\n", kSXVersion);
      return 0;
    }
    if (arg == "--spawn") {
      options.spawn = true;
    } else if (arg == "--keep") {
      options.keep = true;
    } else if (arg == "--baseline") {
      options.baseline = true;
    } else if (arg == "--json") {
      options.json = true;
    } else if (arg.rfind("--", 0) != 0) {
      return usageError("unexpected argument '" + arg + "'");
    } else if (i + 1 >= argc) {
      return usageError(arg + " needs a value");
    } else if (!applyValue(arg, argv[i + 1], options)) {
      return usageError("bad option " + arg + " " + argv[i + 1]);
    } else {
      ++i;
    }
  }
  if (options.spawn && !options.socketPath.empty()) {
    return usageError("--spawn and --socket exclude each other");
  }
  if (!options.spawn) {
    SXPaths paths = SXPaths::fromEnvironment();
    if (options.socketPath.empty()) options.socketPath = paths.socketPath;
    if (options.stateDir.empty()) options.stateDir = paths.stateDir;
  }
  return -1;
}
