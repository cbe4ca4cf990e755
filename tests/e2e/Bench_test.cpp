// The benchmark driver against a daemon it spawns itself: every scenario runs, reports its
// figures and finds every message in the stores. No speed is asserted.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <string>

#include "support/Daemon.h"

namespace {

std::string benchPath() {
  return (std::filesystem::path(SXR_CTL_PATH).parent_path() / "sxreport-bench").string();
}

CommandRun runBench(const std::string& args) {
  return runCommand(benchPath() + " " + args + " 2>/dev/null");
}

SXValue parse(const CommandRun& run) {
  SXValue json = SXValue::parse(run.output, nullptr, false);
  EXPECT_FALSE(json.is_discarded()) << run.output;
  return json.is_discarded() ? SXValue::object() : json;
}

void expectMeasured(const SXValue& figures, const std::string& scenario) {
  SCOPED_TRACE(scenario + " " + figures.value("target", "?"));
  EXPECT_GT(figures["messagesPerSecond"].get<double>(), 0);
  EXPECT_GT(figures["requests"].get<int64_t>(), 0);
  for (const char* key : {"p50", "p99", "max"}) {
    EXPECT_GT(figures["latencyMicros"][key].get<double>(), 0) << key;
  }
  EXPECT_LE(figures["latencyMicros"]["p50"].get<double>(),
            figures["latencyMicros"]["max"].get<double>());
  EXPECT_TRUE(figures["cpuSecondsPerMillion"].is_number());
  EXPECT_EQ(figures["errors"], SXValue::array());
}

class BenchEndToEnd : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!std::filesystem::exists(benchPath())) {
      FAIL() << benchPath() << " is missing: build the sxreport-bench target";
    }
  }
};

}  // namespace

TEST_F(BenchEndToEnd, EveryScenarioAgainstASpawnedDaemonAndTheBaseline) {
  CommandRun run = runBench(
      "--spawn --baseline --json --scenario all --clients 2 --messages 300 --sessions 3 "
      "--window 16 --stop-every 100");
  ASSERT_EQ(run.status, 0) << run.output;
  SXValue json = parse(run);
  EXPECT_EQ(json["ok"], true);
  ASSERT_EQ(json["results"].size(), 6u) << run.output;

  for (const SXValue& result : json["results"]) {
    std::string scenario = result["scenario"];
    SCOPED_TRACE(scenario);
    EXPECT_EQ(result["ok"], true);
    EXPECT_EQ(result["clients"], 2);
    const SXValue& daemon = result["daemon"];
    if (scenario == "idle") {
      EXPECT_EQ(daemon["sessions"], 6);
      EXPECT_GT(daemon["idleRssKiB"].get<int64_t>(), 0);
      EXPECT_GT(daemon["rssWithSessionsKiB"].get<int64_t>(), 0);
      EXPECT_TRUE(result["baseline"].is_null());
      continue;
    }
    expectMeasured(daemon, scenario);
    expectMeasured(result["baseline"], scenario);
    EXPECT_GT(daemon["peakRssKiB"].get<int64_t>(), 0);
    EXPECT_TRUE(result["ratio"]["throughput"].is_number());
    EXPECT_TRUE(result["ratio"]["p99"].is_number());
    EXPECT_TRUE(result["baseline"]["rows"].is_null());
    if (scenario == "rpc") {
      EXPECT_EQ(result["window"], 1);
      EXPECT_TRUE(daemon["rows"].is_null());
      continue;
    }
    // A broadcast lands once in each of the two clients' sessions.
    int64_t expected = scenario == "broadcast" ? 1200 : 600;
    for (const char* store : {"tallyvane", "fernreporting"}) {
      EXPECT_EQ(daemon["rows"][store]["expected"], expected) << store;
      EXPECT_EQ(daemon["rows"][store]["missing"], 0) << store;
      EXPECT_GE(daemon["rows"][store]["found"].get<int64_t>(), expected) << store;
    }
  }
}

TEST_F(BenchEndToEnd, AnUnreachableDaemonIsAnError) {
  CommandRun unreachable =
      runBench("--json --scenario rpc --socket /nonexistent/sxr.sock --state-dir /nonexistent");
  EXPECT_EQ(unreachable.status, 1) << unreachable.output;
  SXValue json = parse(unreachable);
  EXPECT_EQ(json["ok"], false);
  ASSERT_EQ(json["results"].size(), 1u);
  EXPECT_NE(json["results"][0]["daemon"]["errors"][0].get<std::string>().find("cannot connect"),
            std::string::npos);
}

// A bad option or environment variable of the benchmark or the daemon it spawns is one line on
// standard error and exit status 2. The benchmark finds the optional daemon flags to drop by the
// daemon's "unknown option" line.
TEST_F(BenchEndToEnd, BadOptionsAndEnvironmentVariablesAreOneLineUsageErrors) {
  struct Row {
    std::string command;  // environment, then the arguments
    std::string line;     // how the error line begins
  };
  const std::string bench = benchPath(), daemon = SXR_DAEMON_PATH;
  const Row rows[] = {
      {bench + " --clients 0", "sxreport-bench: --clients: not a number from 1 to 4096: '0'"},
      {bench + " --clients 4097", "sxreport-bench: --clients: not a number from 1 to 4096"},
      {bench + " --messages -1", "sxreport-bench: --messages: not a number from 1 on: '-1'"},
      {bench + " --attack-seconds 3601", "sxreport-bench: --attack-seconds: not a number of"},
      {bench + " --drain-timeout nan", "sxreport-bench: --drain-timeout: not a positive number"},
      {bench + " --scenario rpc,nonsense", "sxreport-bench: --scenario: not a list of scenarios"},
      {bench + " --daemon-flag novalue", "sxreport-bench: --daemon-flag: not NAME=VALUE"},
      {bench + " --spawn --socket /tmp/x", "sxreport-bench: --spawn excludes --socket"},
      {daemon + " --max-sessions 0",
       "sxreportingd: --max-sessions (SXREPORTING_MAX_SESSIONS): not a positive number: '0'"},
      {daemon + " --max-payload-bytes 18446744073709551616",
       "sxreportingd: --max-payload-bytes (SXREPORTING_MAX_PAYLOAD_BYTES): not a positive"},
      {"SXREPORTING_MAX_REPORTER_IDS=-1 " + daemon,
       "sxreportingd: --max-reporter-ids (SXREPORTING_MAX_REPORTER_IDS): not a positive number"},
      {"SXREPORTING_DRAIN_TIMEOUT_MS=1s " + daemon,
       "sxreportingd: --drain-timeout-ms (SXREPORTING_DRAIN_TIMEOUT_MS): not a positive"},
      {daemon + " --socket-mode 0778",
       "sxreportingd: --socket-mode (SXREPORTING_SOCKET_MODE): "
       "not an octal mode up to 0777: '0778'"},
      {"SXREPORTING_SOCKET_MODE=660x " + daemon, "sxreportingd: --socket-mode"},
      {"SXREPORTING_MAX_MESSAGE_BYTES=0 " + daemon, "sxreportingd: --max-message-bytes"},
      {"SXREPORTING_LOG_SCOPES=sxrs=loud " + daemon, "sxreportingd: --log-scope"},
      {daemon + " --partial-frame-timeout-ms", "sxreportingd: --partial-frame-timeout-ms"},
      {daemon + " --no-such-limit 5", "sxreportingd: unknown option --no-such-limit\n"},
  };
  for (const auto& row : rows) {
    // A row that parses would start a daemon on the default directories.
    CommandRun run = runCommand("timeout 10 env " + row.command + " 2>&1 >/dev/null");
    EXPECT_EQ(run.status, 2) << row.command;
    EXPECT_TRUE(run.output.starts_with(row.line)) << row.command << ": " << run.output;
    EXPECT_EQ(std::count(run.output.begin(), run.output.end(), '\n'), 1) << run.output;
  }
}
