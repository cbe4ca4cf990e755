#include "BenchOptions.h"

#include <limits>
#include <sstream>

#include "SXVersion.h"
#include "common/SXCommandLine.h"
#include "common/SXPaths.h"

namespace {

constexpr const char* kDescription =
    "Drives sxreportingd with N client connections and reports messages per second, reply\n"
    "latency (p50/p99/max), daemon CPU seconds per million messages, daemon peak RSS and, for\n"
    "the message scenarios, the rows that reached tallyvane.db and fernreporting.db. With\n"
    "--baseline it runs the same clients against a MessagePack-RPC echo server and prints the\n"
    "ratio daemon / baseline. Exit status 0 when every reply came and every row landed, 2 after\n"
    "a usage error.";

constexpr const char* kScenarios =
    "Scenarios:\n"
    "  addressed   pipelined sends to each client's own started session\n"
    "  broadcast   pipelined sends to every started session (each lands once per client)\n"
    "  standalone  sends to each client's own session, created but not started (telephony,\n"
    "              so no random delay), which go to the spool as single messages\n"
    "  lifecycle   loops of create / start / send x10 / stop / destroy\n"
    "  rpc         ping-pong reporterID:valid: (window 1)\n"
    "  idle        daemon RSS idle, after creating the sessions, and after they are gone\n"
    "  abuse       (not in all) hostile clients, one attack after another, then all at once,\n"
    "              while a well-behaved one times reporterID:valid:; checks the daemon's peak\n"
    "              RSS, that latency and its log size against targets (exit 0 when missed)";

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

template <typename T>
void count(CLI::App& app, const char* name, T& value, T min, T max, const char* help) {
  const std::string range =
      max == std::numeric_limits<T>::max()
          ? "a number from " + std::to_string(min) + " on"
          : "a number from " + std::to_string(min) + " to " + std::to_string(max);
  app.add_option(name, value, help)
      ->type_name("N")
      ->group("load")
      ->transform(SXNumber<T>(min, max, range));
}

void seconds(CLI::App& app, const char* name, double& value, double max, const char* help) {
  app.add_option(name, value, help)
      ->type_name("S")
      ->group("load")
      ->transform(SXNumber<double>(std::numeric_limits<double>::min(), max,
                                   max < 1e9 ? "a number of seconds above 0, at most 3600"
                                             : "a positive number of seconds"));
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

std::optional<int> ParseBenchOptions(int argc, char** argv, BenchOptions& options) {
  CLI::App app(kDescription, "sxreport-bench");
  SXSetUpCommandLine(app, kSXVersion);
  app.footer(kScenarios);
  auto* spawn = app.add_flag("--spawn", options.spawn,
                             "start a daemon for each scenario on a temporary socket and\n"
                             "state directory")
                    ->group("target");
  app.add_option("--daemon", options.daemonPath,
                 "the daemon to spawn (default: sxreportingd beside this program)")
      ->type_name("PATH")
      ->group("target");
  app.add_flag("--keep", options.keep, "keep the spawned daemons' directories (and their logs)")
      ->group("target");
  app.add_option_function<std::vector<std::string>>(
         "--daemon-flag",
         [&options](const std::vector<std::string>& flags) {
           for (const auto& flag : flags) {
             if (!parseDaemonFlag(flag, options.daemonFlags)) {
               throw CLI::ValidationError("--daemon-flag", "not NAME=VALUE: '" + flag + "'");
             }
           }
         },
         "pass '--NAME VALUE' to every spawned daemon (repeatable)")
      ->type_name("NAME=VALUE")
      ->allow_extra_args(false)
      ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll)
      ->group("target");
  app.add_option("--socket", options.socketPath,
                 "a running daemon (default: the service's socket, as sxreportctl)")
      ->type_name("PATH")
      ->group("target")
      ->excludes(spawn);
  app.add_option("--state-dir", options.stateDir,
                 "that daemon's state directory, for the row counts")
      ->type_name("DIR")
      ->group("target");
  app.add_flag("--baseline", options.baseline, "also run every scenario against the echo server")
      ->group("target");
  app.add_option_function<std::string>(
         "--scenario",
         [&options](const std::string& text) {
           if (!parseScenarios(text, options.scenarios)) {
             throw CLI::ValidationError("--scenario", "not a list of scenarios: '" + text + "'");
           }
         },
         "the scenarios below, or all of them but abuse\n(default addressed)")
      ->type_name("NAME[,NAME...]")
      ->group("load");
  const uint64_t unlimited = std::numeric_limits<uint64_t>::max();
  count<size_t>(app, "--clients", options.clients, 1, 4096, "client connections (default 4)");
  count<uint64_t>(app, "--messages", options.messages, 1, unlimited,
                  "messages per client (default 20000; lifecycle: N/10 loops)");
  count<size_t>(app, "--sessions", options.sessions, 1, (1u << 24) - 1,
                "sessions per client, the active one included; the others are\n"
                "created and left idle (default 1)");
  count<size_t>(app, "--window", options.window, 1, 65536,
                "requests in flight per client (default 32)");
  count<uint64_t>(app, "--stop-every", options.stopEvery, 0, unlimited,
                  "addressed: stop and restart the session every N messages\n(default never)");
  count<size_t>(app, "--rss-samples", options.rssSamples, 1, 10000,
                "daemon RSS samples during the run (default 10)");
  const double forever = std::numeric_limits<double>::max();
  seconds(app, "--drain-timeout", options.drainTimeoutSeconds, forever,
          "give up on missing rows after S seconds without a new one (60)");
  seconds(app, "--reply-timeout", options.replyTimeoutSeconds, forever,
          "give up after S seconds without any reply (30)");
  seconds(app, "--attack-seconds", options.attackSeconds, 3600,
          "abuse: how long each attack runs (default 4)");
  count<size_t>(app, "--partial-connections", options.partialConnections, 0, 100'000,
                "abuse: connections left mid-request (default 1000)");
  app.add_flag("--json", options.json, "one JSON object on stdout")->group("output");

  if (auto status = SXParseMainCommandLine(app, argc, argv)) return status;
  if (!options.spawn) {
    SXPaths paths = SXPaths::fromEnvironment();
    if (options.socketPath.empty()) options.socketPath = paths.socketPath;
    if (options.stateDir.empty()) options.stateDir = paths.stateDir;
  }
  return std::nullopt;
}
