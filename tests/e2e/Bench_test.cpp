// The benchmark driver against a daemon it spawns itself: every scenario runs, reports its
// figures and finds every message in the stores. No speed is asserted.
#include <gtest/gtest.h>

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

TEST_F(BenchEndToEnd, AnUnreachableDaemonIsAnErrorAndBadOptionsAUsageError) {
  CommandRun unreachable =
      runBench("--json --scenario rpc --socket /nonexistent/sxr.sock --state-dir /nonexistent");
  EXPECT_EQ(unreachable.status, 1) << unreachable.output;
  SXValue json = parse(unreachable);
  EXPECT_EQ(json["ok"], false);
  ASSERT_EQ(json["results"].size(), 1u);
  EXPECT_NE(json["results"][0]["daemon"]["errors"][0].get<std::string>().find("cannot connect"),
            std::string::npos);

  EXPECT_EQ(runBench("--clients 0").status, 2);
  EXPECT_EQ(runBench("--scenario nonsense").status, 2);
  EXPECT_EQ(runBench("--spawn --socket /tmp/x").status, 2);
}
