// sxreport-bench: drives sxreportingd (and, for comparison, a bare MessagePack-RPC echo
// server) with N pipelined clients and reports throughput, latency, CPU, memory and whether
// every message reached the stores.
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <memory>

#include "BenchReport.h"
#include "EchoServer.h"
#include "SpawnedDaemon.h"

namespace {

// A temporary directory for the echo server's socket, removed with the object.
class TempDir {
 public:
  TempDir() {
    std::string pattern =
        (std::filesystem::temp_directory_path() / "sxreport-bench-echo-XXXXXX").string();
    if (::mkdtemp(pattern.data()) != nullptr) path_ = pattern;
  }
  ~TempDir() {
    std::error_code ignored;
    if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

TargetFigures runOnDaemon(const BenchScenario& scenario, const BenchOptions& options) {
  BenchTarget target;
  target.name = "daemon";
  target.socketPath = options.socketPath;
  target.stateDir = options.stateDir;
  std::unique_ptr<SpawnedDaemon> daemon;
  if (options.spawn) {
    daemon = std::make_unique<SpawnedDaemon>();
    std::string error;
    std::string path =
        options.daemonPath.empty() ? SpawnedDaemon::besideExecutable() : options.daemonPath;
    std::vector<DaemonFlag> flags = scenario.daemonFlags();
    flags.insert(flags.end(), options.daemonFlags.begin(), options.daemonFlags.end());
    if (!daemon->start(path, options.keep, flags, error)) {
      TargetFigures figures;
      figures.target = target.name;
      figures.errors.push_back("cannot start " + path + ": " + error);
      return figures;
    }
    target.socketPath = daemon->socket();
    target.stateDir = daemon->stateDir();
    target.pid = daemon->pid();
    target.logBytes = [&daemon] { return daemon->logBytes(); };
  }
  TargetFigures figures =
      scenario.kind() == ScenarioKind::kIdle    ? RunIdle(scenario, options, target)
      : scenario.kind() == ScenarioKind::kAbuse ? RunAbuse(scenario, options, target)
                                                : RunScenario(scenario, options, target);
  if (daemon && figures.abuse) {
    for (const auto& flag : daemon->refusedFlags()) {
      figures.abuse->notes.push_back("this daemon refuses " + flag.name + " " + flag.value +
                                     ", so it ran with its own default");
    }
  }
  if (daemon && !figures.errors.empty()) {
    figures.errors.push_back("daemon log (" + daemon->directory() + "/daemon.log) ends:\n" +
                             daemon->logTail());
  }
  return figures;
}

TargetFigures runOnBaseline(const BenchScenario& scenario, const BenchOptions& options) {
  TargetFigures failed;
  failed.target = "baseline";
  TempDir dir;
  EchoServer server;
  std::string error;
  if (dir.path().empty()) {
    failed.errors.push_back("cannot create a temporary directory");
    return failed;
  }
  if (!server.start(dir.path() + "/echo.sock", error)) {
    failed.errors.push_back(error);
    return failed;
  }
  BenchTarget target;
  target.name = "baseline";
  target.socketPath = dir.path() + "/echo.sock";
  target.pid = ::getpid();
  target.inProcessCpuSeconds = [&server] { return server.cpuSeconds(); };
  target.checkResults = false;
  return RunScenario(scenario, options, target);
}

}  // namespace

int main(int argc, char** argv) {
  BenchOptions options;
  if (auto status = ParseBenchOptions(argc, argv, options)) return *status;
  ::signal(SIGPIPE, SIG_IGN);

  bool ok = true;
  SXValue results = SXValue::array();
  for (ScenarioKind kind : options.scenarios) {
    BenchScenario scenario(kind, options);
    ScenarioResult result{kind, scenario.window(), runOnDaemon(scenario, options), std::nullopt};
    // Neither the idle nor the abuse figures mean anything for the echo server.
    if (options.baseline && kind != ScenarioKind::kIdle && kind != ScenarioKind::kAbuse) {
      result.baseline = runOnBaseline(scenario, options);
    }
    ok = ok && result.ok();
    if (options.json) {
      results.push_back(ScenarioResultJson(result, options));
    } else {
      std::fputs(ScenarioResultText(result, options).c_str(), stdout);
      std::fputs("\n", stdout);
      std::fflush(stdout);
    }
  }
  if (options.json) {
    std::puts(SXValue{{"results", results}, {"ok", ok}}.dump().c_str());
  }
  return ok ? 0 : 1;
}
