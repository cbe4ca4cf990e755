// The benchmark driver against a daemon it spawns itself: every scenario runs and finds every
// message in the stores. No speed is asserted.
#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "support/Daemon.h"

namespace {

const std::string kBench =
    (std::filesystem::path(SXR_CTL_PATH).parent_path() / "sxreport-bench").string();

TEST(BenchEndToEnd, EveryScenarioRunsAgainstASpawnedDaemonAndLosesNoRow) {
  ASSERT_TRUE(std::filesystem::exists(kBench)) << "build the sxreport-bench target";
  CommandRun run = runCommand(kBench + " --json --spawn --scenario all --clients 2 " +
                              "--messages 300 --sessions 3 --window 16 2>/dev/null");
  EXPECT_EQ(run.status, 0) << run.output;
  SXValue json = SXValue::parse(run.output, nullptr, false);
  ASSERT_TRUE(json.is_object()) << run.output;
  ASSERT_EQ(json["results"].size(), 6u) << json.dump();
  int withRows = 0;
  for (const SXValue& result : json["results"]) {
    SCOPED_TRACE(result.dump());
    EXPECT_EQ(result["ok"], true);
    const SXValue rows = result["daemon"].value("rows", SXValue());
    if (!rows.is_object()) continue;  // rpc and idle store nothing
    ++withRows;
    for (const char* store : {"tallyvane", "fernreporting"}) {
      EXPECT_EQ(rows.at(store).at("missing"), 0) << store;
    }
  }
  EXPECT_EQ(withRows, 4);
}

}  // namespace
