// The benchmark driver against a daemon it spawns itself: every scenario runs, reports its
// figures and finds every message in the stores. No speed is asserted.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <string>

#include "support/Daemon.h"

namespace {

const std::string kBench =
    (std::filesystem::path(SXR_CTL_PATH).parent_path() / "sxreport-bench").string();

SXValue runBench(const std::string& args, int status) {
  CommandRun run = runCommand(kBench + " --json " + args + " 2>/dev/null");
  EXPECT_EQ(run.status, status) << run.output;
  SXValue json = SXValue::parse(run.output, nullptr, false);
  EXPECT_TRUE(json.is_object()) << run.output;
  return json.is_object() ? json : SXValue::object();
}

}  // namespace

TEST(BenchEndToEnd, EveryScenarioAgainstASpawnedDaemonAndTheBaseline) {
  ASSERT_TRUE(std::filesystem::exists(kBench)) << "build the sxreport-bench target";
  SXValue json = runBench(
      "--spawn --baseline --scenario all --clients 2 --messages 300 --sessions 3 --window 16 "
      "--stop-every 100",
      0);
  EXPECT_EQ(json["ok"], true);
  ASSERT_EQ(json["results"].size(), 6u) << json.dump();
  for (const SXValue& result : json["results"]) {
    std::string scenario = result["scenario"];
    SCOPED_TRACE(scenario);
    EXPECT_EQ(result["ok"], true);
    const SXValue& daemon = result["daemon"];
    if (scenario == "idle") {
      EXPECT_EQ(daemon["sessions"], 6);
      EXPECT_GT(daemon["rssWithSessionsKiB"].get<int64_t>(), 0);
      continue;
    }
    for (const SXValue& figures : {daemon, result["baseline"]}) {
      EXPECT_GT(figures["messagesPerSecond"].get<double>(), 0);
      EXPECT_GT(figures["latencyMicros"]["p50"].get<double>(), 0);
      EXPECT_EQ(figures["errors"], SXValue::array());
    }
    if (scenario == "rpc") continue;
    // A broadcast lands once in each of the two clients' sessions.
    int64_t expected = scenario == "broadcast" ? 1200 : 600;
    for (const char* store : {"tallyvane", "fernreporting"}) {
      EXPECT_EQ(daemon["rows"][store]["expected"], expected) << store;
      EXPECT_EQ(daemon["rows"][store]["missing"], 0) << store;
    }
  }

  SXValue unreachable =
      runBench("--scenario rpc --socket /nonexistent/sxr.sock --state-dir /nonexistent", 1);
  EXPECT_EQ(unreachable["ok"], false);
  EXPECT_TRUE(unreachable["results"][0]["daemon"]["errors"][0].get<std::string>().starts_with(
      "cannot connect"))
      << unreachable.dump();
}

// A bad option or environment variable of the benchmark or the daemon it spawns is one line on
// standard error and exit status 2. The benchmark finds the optional daemon flags to drop by the
// daemon's "unknown option" line.
TEST(BenchEndToEnd, BadOptionsAndEnvironmentVariablesAreOneLineUsageErrors) {
  const std::string daemon = SXR_DAEMON_PATH;
  const std::pair<std::string, std::string> rows[] = {
      // the command, environment first; how its error line begins
      {kBench + " --clients 4097", "sxreport-bench: --clients: not a number from 1 to 4096"},
      {kBench + " --messages -1", "sxreport-bench: --messages: not a number from 1 on: '-1'"},
      {kBench + " --drain-timeout nan", "sxreport-bench: --drain-timeout: not a positive number"},
      {kBench + " --scenario rpc,nonsense", "sxreport-bench: --scenario: not a list of scenarios"},
      {kBench + " --daemon-flag novalue", "sxreport-bench: --daemon-flag: not NAME=VALUE"},
      {kBench + " --spawn --socket /tmp/x", "sxreport-bench: --spawn excludes --socket"},
      {daemon + " --max-sessions 0",
       "sxreportingd: --max-sessions (SXREPORTING_MAX_SESSIONS): not a positive number: '0'"},
      {daemon + " --max-payload-bytes 18446744073709551616",
       "sxreportingd: --max-payload-bytes (SXREPORTING_MAX_PAYLOAD_BYTES): not a positive"},
      {"SXREPORTING_DRAIN_TIMEOUT_MS=1s " + daemon,
       "sxreportingd: --drain-timeout-ms (SXREPORTING_DRAIN_TIMEOUT_MS): not a positive"},
      {daemon + " --socket-mode 0778",
       "sxreportingd: --socket-mode (SXREPORTING_SOCKET_MODE): not an octal mode up to 0777"},
      {"SXREPORTING_LOG_SCOPES=sxrs=loud " + daemon, "sxreportingd: --log-scope"},
      {daemon + " --partial-frame-timeout-ms", "sxreportingd: --partial-frame-timeout-ms"},
      {daemon + " --no-such-limit 5", "sxreportingd: unknown option --no-such-limit\n"},
  };
  for (const auto& [command, line] : rows) {
    // A row that parses would start a daemon on the default directories.
    CommandRun run = runCommand("timeout 10 env " + command + " 2>&1 >/dev/null");
    EXPECT_EQ(run.status, 2) << command;
    EXPECT_TRUE(run.output.starts_with(line)) << command << ": " << run.output;
    EXPECT_EQ(std::count(run.output.begin(), run.output.end(), '\n'), 1) << run.output;
  }
}
