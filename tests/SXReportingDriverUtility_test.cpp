// The driver utility over a driver library that fails one query, sampling or delta at a time:
// each failure leaves out, or falls back for, its own driver only. (The fake is the production
// library on a real counter tree; the daemon's session stop reads the deltas end to end.)
#include "Statistics/SXReportingDriverUtility.h"

#include <gtest/gtest.h>

#include "fakes/FakeKestrel.h"
#include "fakes/FakeLog.h"

namespace {

struct Rig {
  Rig() {
    // Channels in each of the four driver groups, plus one the drivers must not pick up.
    kestrel->setValue("VendraAE2MCA", std::nullopt, "Underruns", 3);
    kestrel->setValue("Speaker", std::nullopt, "Temp", 40);
    kestrel->setValue("Speaker", std::nullopt, std::nullopt, 2);
    kestrel->setValue("Codec", "MCA", "Overruns", 1);
    kestrel->setValue("Haptics", "Stats", "Clips", 7);
    kestrel->setValue("Haptics", "Other", "Ignored", 100);
  }
  SXReportingDriverUtility& utility() {
    if (!utility_) {
      SXPlatform platform;
      platform.log = log;
      platform.kestrel = kestrel;
      environment_ = std::make_unique<SXReportingEnvironment>(std::move(platform));
      utility_ = std::make_unique<SXReportingDriverUtility>(*environment_);
    }
    return *utility_;
  }
  std::vector<std::string> descriptions() {
    std::vector<std::string> out;
    for (const auto& s : utility().ioChannelSubscriptions()) {
      out.push_back(s->driver()->description());
    }
    return out;
  }

  std::shared_ptr<FakeLog> log = std::make_shared<FakeLog>();
  std::shared_ptr<FakeKestrel> kestrel = std::make_shared<FakeKestrel>();
  std::unique_ptr<SXReportingEnvironment> environment_;
  std::unique_ptr<SXReportingDriverUtility> utility_;
};

}  // namespace

TEST(SXReportingDriverUtility, GroupsWithoutChannelsOrWithFailedQueriesAreLeftOut) {
  Rig rig;
  rig.kestrel->removeChannel("Speaker", std::nullopt, "Temp");
  rig.kestrel->removeChannel("Speaker", std::nullopt, std::nullopt);  // the group stays, empty
  rig.kestrel->failChannelQuery(std::nullopt, "MCA", 7, /*returnChannels=*/true);
  rig.kestrel->failChannelQuery("Haptics", "Stats", std::nullopt, /*returnChannels=*/false);
  EXPECT_EQ(rig.descriptions(), (std::vector<std::string>{"VendraAE2MCA-(null)", "(null)-MCA"}));
  EXPECT_TRUE(rig.log->contains("error 7 getting channels for driver (null)-MCA"));
}

TEST(SXReportingDriverUtility, AbsoluteValuesOfAtLeastOneWithoutASnapshot) {
  Rig rig;
  rig.kestrel->setValue("Codec", "MCA", "Idle", 0);
  rig.kestrel->setValue("Codec", "MCA", "Negative", -4);
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(std::nullopt),
            (SXValue{{"VendraAE2MCA_Underruns", 3},
                     {"Speaker_Temp", 40},
                     {"Speaker_", 2},
                     {"MCA_Overruns", 1},
                     {"Haptics_Stats_Clips", 7}}));
  EXPECT_EQ(rig.kestrel->deltaCalls(), 0);
}

TEST(SXReportingDriverUtility, ADeltaHoldsWhatRoseOnTheSubscribedChannelsOrNothing) {
  Rig rig;
  SXValue snapshot = rig.utility().getSnapShot();
  EXPECT_EQ(snapshot.size(), 4u);
  rig.kestrel->setValue("VendraAE2MCA", std::nullopt, "Underruns", 10);
  rig.kestrel->setValue("Speaker", std::nullopt, std::nullopt, 3);
  rig.kestrel->setValue("Codec", "MCA", "Overruns", 0);  // went down
  rig.kestrel->setValue("Haptics", "Stats", "New", 50);  // appeared after subscribing
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(snapshot),
            (SXValue{{"VendraAE2MCA_Underruns", 7}, {"Speaker_", 1}}));
  // Nothing rose since a fresh snapshot: none, rather than an empty dictionary.
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(rig.utility().getSnapShot()),
            std::nullopt);
}

TEST(SXReportingDriverUtility, ASamplingOrDeltaFailureCostsOnlyItsOwnDriver) {
  Rig rig;
  rig.kestrel->failSampling("Speaker", std::nullopt, 5);
  rig.kestrel->failSampling("Haptics", "Stats", std::nullopt);  // nothing back, no error
  SXValue snapshot = rig.utility().getSnapShot();
  std::vector<std::string> keys;
  for (const auto& [key, value] : snapshot.items()) keys.push_back(key);
  EXPECT_EQ(keys, (std::vector<std::string>{"(null)-MCA", "VendraAE2MCA-(null)"}));
  EXPECT_EQ(rig.log->count("KestrelCreateSamples error 5"), 1u);
  EXPECT_FALSE(rig.log->contains("error 0"));

  rig.kestrel->setValue("VendraAE2MCA", std::nullopt, "Underruns", 4);
  rig.kestrel->setValue("Speaker", std::nullopt, "Temp", 41);
  rig.kestrel->setValue("Haptics", "Stats", "Clips", 9);
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(snapshot),
            (SXValue{{"VendraAE2MCA_Underruns", 1}}));

  // Sampling works again but the snapshot has no entry: the library refuses the delta and the
  // absolute values are reported for that driver only; so too when a delta fails outright.
  rig.kestrel->restoreSampling("Speaker", std::nullopt);
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(snapshot),
            (SXValue{{"VendraAE2MCA_Underruns", 1}, {"Speaker_Temp", 41}, {"Speaker_", 2}}));
  EXPECT_EQ(rig.log->count("KestrelCreateSamplesDelta error 22"), 1u);

  Rig other;
  SXValue whole = other.utility().getSnapShot();
  other.kestrel->setValue("VendraAE2MCA", std::nullopt, "Underruns", 6);
  other.kestrel->failDelta("Haptics", "Stats", 9);
  EXPECT_EQ(other.utility().getDriverStatisticsRelativeToSnapShot(whole),
            (SXValue{{"VendraAE2MCA_Underruns", 3}, {"Haptics_Stats_Clips", 7}}));
  EXPECT_TRUE(other.log->contains("KestrelCreateSamplesDelta error 9"));
}

TEST(SXReportingDriverUtility, ASubscriptionWithoutAHandleIsKeptAndFailsToSample) {
  Rig rig;
  rig.kestrel->setSubscriptionReturnsNull(true);
  ASSERT_EQ(rig.utility().ioChannelSubscriptions().size(), 4u);
  EXPECT_EQ(rig.utility().ioChannelSubscriptions()[0]->subscription(), nullptr);
  EXPECT_EQ(rig.utility().getSnapShot(), SXValue::object());
  EXPECT_EQ(rig.utility().getDriverStatisticsRelativeToSnapShot(std::nullopt), std::nullopt);
  EXPECT_EQ(rig.log->count("KestrelCreateSamples error 22"), 8u);
}
