#include "SXReportingDriverUtility.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/FakeKestrel.h"
#include "fakes/FakeLog.h"

namespace {

using ::testing::ElementsAre;

constexpr const char* kInitPrefix = ":-[SXReportingDriverUtility init]: ";
constexpr const char* kSnapShotPrefix = ":-[SXReportingDriverUtility getSnapShot]: ";
constexpr const char* kStatisticsPrefix =
    ":-[SXReportingDriverUtility getDriverStatisticsRelativeToSnapShot:]: ";

class DriverUtilityTest : public ::testing::Test {
 protected:
  // Channels in each of the four driver groups, plus one the drivers must not pick up.
  void publishAllGroups() {
    kestrel_->setValue("VendraAE2MCA", std::nullopt, "Underruns", 3);
    kestrel_->setValue("Speaker", std::nullopt, "Temp", 40);
    kestrel_->setValue("Speaker", std::nullopt, std::nullopt, 2);
    kestrel_->setValue("Codec", "MCA", "Overruns", 1);
    kestrel_->setValue("Haptics", "Stats", "Clips", 7);
    kestrel_->setValue("Haptics", "Other", "Ignored", 100);
  }

  SXReportingDriverUtility& utility() {
    if (!utility_) {
      SXPlatform platform;
      platform.log = log_;
      platform.kestrel = kestrel_;
      environment_ = std::make_unique<SXReportingEnvironment>(std::move(platform));
      utility_ = std::make_unique<SXReportingDriverUtility>(*environment_);
    }
    return *utility_;
  }

  std::vector<std::string> descriptions() {
    std::vector<std::string> out;
    for (const auto& s : utility().ioChannelSubscriptions())
      out.push_back(s->driver()->description());
    return out;
  }

  // The lines written with `prefix` (file and line stripped), as "<level>|<message>".
  std::vector<std::string> linesIn(const std::string& prefix) const {
    std::vector<std::string> out;
    for (const auto& line : log_->lines()) {
      if (line.text.find(prefix) == std::string::npos) continue;
      EXPECT_EQ(line.scope, "sxrd") << line.text;
      const char* level = line.level == SXLogLevel::kInfo    ? "info"
                          : line.level == SXLogLevel::kError ? "error"
                          : line.level == SXLogLevel::kDebug ? "debug"
                                                             : "default";
      out.push_back(std::string(level) + "|" + line.message);
    }
    return out;
  }

  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
  std::shared_ptr<FakeKestrel> kestrel_ = std::make_shared<FakeKestrel>();
  std::unique_ptr<SXReportingEnvironment> environment_;
  std::unique_ptr<SXReportingDriverUtility> utility_;
};

TEST_F(DriverUtilityTest, SubscribesToTheFourGroupsInTableOrder) {
  publishAllGroups();
  utility();

  EXPECT_THAT(descriptions(),
              ElementsAre("VendraAE2MCA-(null)", "Speaker-(null)", "(null)-MCA", "Haptics-Stats"));
  EXPECT_THAT(linesIn(kInitPrefix),
              ElementsAre("info|creating kestrelstats driver utility",
                          "default|subscribed to group group VendraAE2MCA-(null)",
                          "default|subscribed to group group Speaker-(null)",
                          "default|subscribed to group group (null)-MCA",
                          "default|subscribed to group group Haptics-Stats"));
}

TEST_F(DriverUtilityTest, GroupsWithoutChannelsOrWithFailedQueriesAreLeftOut) {
  publishAllGroups();
  kestrel_->removeChannel("Speaker", std::nullopt, "Temp");
  kestrel_->removeChannel("Speaker", std::nullopt, std::nullopt);  // the group stays, empty
  kestrel_->failChannelQuery(std::nullopt, "MCA", 7, /*returnChannels=*/true);
  kestrel_->failChannelQuery("Haptics", "Stats", std::nullopt, /*returnChannels=*/false);

  EXPECT_THAT(descriptions(), ElementsAre("VendraAE2MCA-(null)", "(null)-MCA"));
  EXPECT_THAT(linesIn(kInitPrefix),
              ElementsAre("info|creating kestrelstats driver utility",
                          "default|subscribed to group group VendraAE2MCA-(null)",
                          "info|couldn't find any channels for driver group Speaker-(null)",
                          "default|subscribed to group group Speaker-(null)",
                          "error|error 7 getting channels for driver (null)-MCA",
                          "default|subscribed to group group (null)-MCA"));
}

TEST_F(DriverUtilityTest, SnapshotIsKeyedByDriverDescription) {
  publishAllGroups();
  SXValue snapshot = utility().getSnapShot();

  std::vector<std::string> keys;
  for (const auto& [key, value] : snapshot.items()) keys.push_back(key);
  EXPECT_THAT(keys,
              ElementsAre("(null)-MCA", "Haptics-Stats", "Speaker-(null)", "VendraAE2MCA-(null)"));
  EXPECT_THAT(
      linesIn(kSnapShotPrefix),
      ElementsAre("info|sampling driver VendraAE2MCA-(null)", "info|sampling driver Speaker-(null)",
                  "info|sampling driver (null)-MCA", "info|sampling driver Haptics-Stats"));
}

TEST_F(DriverUtilityTest, WithoutSnapshotReportsAbsoluteValuesOfAtLeastOne) {
  publishAllGroups();
  kestrel_->setValue("Codec", "MCA", "Idle", 0);
  kestrel_->setValue("Codec", "MCA", "Negative", -4);

  auto statistics = utility().getDriverStatisticsRelativeToSnapShot(std::nullopt);
  ASSERT_TRUE(statistics);
  EXPECT_EQ(*statistics, (SXValue{{"VendraAE2MCA_Underruns", 3},
                                  {"Speaker_Temp", 40},
                                  {"Speaker_", 2},
                                  {"MCA_Overruns", 1},
                                  {"Haptics_Stats_Clips", 7}}));
  EXPECT_EQ(kestrel_->deltaCalls(), 0);
}

TEST_F(DriverUtilityTest, SamplingFailureLeavesOutOnlyThatDriver) {
  publishAllGroups();
  kestrel_->failSampling("Speaker", std::nullopt, 5);
  kestrel_->failSampling("Haptics", "Stats", std::nullopt);  // nothing back, no error
  SXValue snapshot = utility().getSnapShot();
  EXPECT_FALSE(snapshot.contains("Speaker-(null)"));
  EXPECT_FALSE(snapshot.contains("Haptics-Stats"));
  EXPECT_TRUE(snapshot.contains("VendraAE2MCA-(null)"));
  EXPECT_TRUE(snapshot.contains("(null)-MCA"));
  EXPECT_EQ(log_->count("KestrelCreateSamples error 5"), 1u);
  EXPECT_FALSE(log_->contains("error 0"));

  kestrel_->setValue("VendraAE2MCA", std::nullopt, "Underruns", 4);
  kestrel_->setValue("Speaker", std::nullopt, "Temp", 41);
  kestrel_->setValue("Haptics", "Stats", "Clips", 9);
  auto statistics = utility().getDriverStatisticsRelativeToSnapShot(snapshot);
  EXPECT_EQ(statistics, (SXValue{{"VendraAE2MCA_Underruns", 1}}));
  // The second driver's lines: the error comes after the "done" line.
  std::vector<std::string> lines = linesIn(kStatisticsPrefix);
  ASSERT_GE(lines.size(), 5u);
  EXPECT_THAT(std::vector<std::string>(lines.begin() + 2, lines.begin() + 5),
              ElementsAre("info|getting latest samples", "info|done getting latest samples",
                          "error|KestrelCreateSamples error 5"));

  // Sampling works again but the snapshot has no entry: the library refuses the delta and
  // the absolute values are reported for that driver only.
  kestrel_->restoreSampling("Speaker", std::nullopt);
  statistics = utility().getDriverStatisticsRelativeToSnapShot(snapshot);
  EXPECT_EQ(statistics,
            (SXValue{{"VendraAE2MCA_Underruns", 1}, {"Speaker_Temp", 41}, {"Speaker_", 2}}));
  EXPECT_EQ(log_->count("KestrelCreateSamplesDelta error 22"), 1u);
}

TEST_F(DriverUtilityTest, DeltaFailureReportsAbsoluteValuesForThatDriver) {
  publishAllGroups();
  SXValue snapshot = utility().getSnapShot();
  kestrel_->setValue("VendraAE2MCA", std::nullopt, "Underruns", 6);
  kestrel_->failDelta("Haptics", "Stats", 9);

  auto statistics = utility().getDriverStatisticsRelativeToSnapShot(snapshot);
  EXPECT_EQ(statistics, (SXValue{{"VendraAE2MCA_Underruns", 3}, {"Haptics_Stats_Clips", 7}}));
  EXPECT_THAT(linesIn(kStatisticsPrefix),
              ::testing::Contains("error|KestrelCreateSamplesDelta error 9"));
}

TEST_F(DriverUtilityTest, SubscriptionWithoutHandleIsKeptAndFailsToSample) {
  publishAllGroups();
  kestrel_->setSubscriptionReturnsNull(true);
  ASSERT_EQ(utility().ioChannelSubscriptions().size(), 4u);
  EXPECT_EQ(utility().ioChannelSubscriptions()[0]->subscription(), nullptr);
  EXPECT_TRUE(utility().ioChannelSubscriptions()[0]->subscribedChannels().has_value());

  EXPECT_EQ(utility().getSnapShot(), SXValue::object());
  EXPECT_EQ(utility().getDriverStatisticsRelativeToSnapShot(std::nullopt), std::nullopt);
  EXPECT_EQ(log_->count("KestrelCreateSamples error 22"), 8u);
}

}  // namespace
