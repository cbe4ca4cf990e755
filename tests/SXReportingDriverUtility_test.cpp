// The driver utility over the production driver library on a temporary counter tree: a driver
// whose group is missing or empty is left out, and one whose snapshot entry is missing falls
// back to its absolute values alone. (The daemon's session stop reads the deltas end to end.)
#include "Statistics/SXReportingDriverUtility.h"

#include <gtest/gtest.h>

#include "fakes/FakeLog.h"
#include "linux/FileKestrel.h"
#include "support/SqliteTestSupport.h"

namespace {

struct Rig {
  Rig() {
    // Channels in each of the four driver groups, plus one the drivers must not pick up.
    set("VendraAE2MCA/-/Underruns", "3");
    set("Speaker/-/Temp", "40");
    set("Speaker/-/-", "2");
    set("Codec/MCA/Overruns", "1");
    set("Haptics/Stats/Clips", "7");
    set("Haptics/Other/Ignored", "100");
  }
  // Writes the counter file `path` (group/subgroup/channel, "-" for an absent name).
  void set(const std::string& path, const std::string& value) {
    std::filesystem::create_directories(std::filesystem::path(tree.file(path)).parent_path());
    std::ofstream(tree.file(path)) << value;
  }
  SXReportingDriverUtility& utility() {
    if (!utility_) {
      SXPlatform platform;
      platform.log = log;
      platform.kestrel = std::make_shared<SXFileKestrel>(tree.path(), log);
      environment_ = std::make_unique<SXReportingEnvironment>(std::move(platform));
      utility_ = std::make_unique<SXReportingDriverUtility>(*environment_);
    }
    return *utility_;
  }

  const SXTestTempDir tree;
  std::shared_ptr<FakeLog> log = std::make_shared<FakeLog>();
  std::unique_ptr<SXReportingEnvironment> environment_;
  std::unique_ptr<SXReportingDriverUtility> utility_;
};

}  // namespace

TEST(SXReportingDriverUtility, GroupsWithoutChannelsAreLeftOutAndValuesBelowOneToo) {
  Rig rig;
  std::filesystem::remove(rig.tree.file("Speaker/-/Temp"));
  std::filesystem::remove(rig.tree.file("Speaker/-/-"));  // the group stays, empty
  std::filesystem::remove_all(rig.tree.file("Haptics/Stats"));
  rig.set("Codec/MCA/Idle", "0");
  rig.set("Codec/MCA/Negative", "-4");
  rig.set("Codec/MCA/Garbled", "x");  // left out of the samples, with an error line
  std::vector<std::string> descriptions;
  for (const auto& s : rig.utility().ioChannelSubscriptions()) {
    descriptions.push_back(s->driver()->description());
  }
  EXPECT_EQ(descriptions, (std::vector<std::string>{"VendraAE2MCA-(null)", "(null)-MCA"}));
  // Without a snapshot: the absolute values, and no delta asked for.
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(std::nullopt),
            (SXValue{{"VendraAE2MCA_Underruns", 3}, {"MCA_Overruns", 1}}));
  EXPECT_FALSE(rig.log->contains("KestrelCreateSamplesDelta"));
  EXPECT_TRUE(rig.log->contains("does not hold a decimal integer"));
}

TEST(SXReportingDriverUtility, ADeltaHoldsWhatRoseOrTheAbsoluteValuesWithoutAnEntry) {
  Rig rig;
  SXValue snapshot = rig.utility().getSnapShot();
  EXPECT_EQ(snapshot.size(), 4u);
  rig.set("VendraAE2MCA/-/Underruns", "10");
  rig.set("Speaker/-/-", "3");
  rig.set("Codec/MCA/Overruns", "0");  // went down
  rig.set("Haptics/Stats/New", "50");  // appeared after subscribing
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(snapshot),
            (SXValue{{"VendraAE2MCA_Underruns", 7}, {"Speaker_", 1}}));
  // Nothing rose since a fresh snapshot: none, rather than an empty dictionary.
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(rig.utility().getSnapShot()),
            std::nullopt);

  // A snapshot without a driver's entry: the library refuses that delta, and the absolute
  // values are reported for that driver only.
  snapshot.erase("Speaker-(null)");
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(snapshot),
            (SXValue{{"VendraAE2MCA_Underruns", 7}, {"Speaker_Temp", 40}, {"Speaker_", 3}}));
  EXPECT_EQ(rig.log->count("KestrelCreateSamplesDelta error 22"), 1u);
}
