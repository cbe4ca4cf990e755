#include "SXReportingUtility.h"

#include <gtest/gtest.h>

#include <thread>

#include "SXReportingEnvironment.h"
#include "fakes/FakeDevice.h"
#include "fakes/FakeLog.h"

TEST(SXReportingUtilityNames, CategoriesComposeComponentAndCategory) {
  EXPECT_EQ(SXReportingUtilityCategoryName(0x00000003), "Playback");
  EXPECT_EQ(SXReportingUtilityCategoryName(0x08000003), "Session_Playback");
  EXPECT_EQ(SXReportingUtilityCategoryName(0x80000009), "Kitbench_KestrelStats");
  EXPECT_EQ(SXReportingUtilityCategoryName(0x00030002), "_Record");
  EXPECT_EQ(SXReportingUtilityCategoryName(0x18000001), "_Generic");
  EXPECT_EQ(SXReportingUtilityCategoryName(0x10000000), "DSP_Undefined");
  EXPECT_EQ(SXReportingUtilityCategoryName(0x40000007), "Routing_RouteChange");
  EXPECT_EQ(SXReportingUtilityCategoryName(0xFFFFFFFF), "Undefined");
  EXPECT_EQ(SXReportingUtilityCategoryName(0), "Undefined");
  EXPECT_EQ(SXReportingUtilityCategoryName(65535), "Undefined");
  EXPECT_EQ(SXReportingUtilityCategoryName(65536), "_Undefined");
}

TEST(SXReportingUtilityNames, MessageKindsStayRightBeyondTheCache) {
  EXPECT_EQ(SXReportingUtilityMessageKind(0x08000003, 1), "Session_Playback_Start");
  EXPECT_EQ(SXReportingUtilityMessageKind(0xFFFFFFFF, 65535), "Undefined_Unknown");
  // Far more pairs than the cache keeps: every answer is still built right.
  for (uint32_t round = 0; round < 2; ++round) {
    for (uint32_t category = 0; category < 600; ++category) {
      ASSERT_EQ(SXReportingUtilityMessageKind(category, 2),
                SXReportingUtilityCategoryName(category) + "_Stop");
    }
  }
  EXPECT_EQ(SXReportingUtilityMessageKind(0x08000003, 1), "Session_Playback_Start");
}

TEST(SXReportingUtilityNames, HostApplicationName) {
  SXValue config = {{"HostApplicationDisplayID", "player"}};
  EXPECT_EQ(SXReportingUtilityHostApplicationName(&config), "player");
  SXValue numeric = {{"HostApplicationDisplayID", 7}};
  EXPECT_EQ(SXReportingUtilityHostApplicationName(&numeric), 7);  // returned as stored
  SXValue other = {{"x", 1}};
  EXPECT_EQ(SXReportingUtilityHostApplicationName(&other), "Unknown");
  EXPECT_EQ(SXReportingUtilityHostApplicationName(nullptr), "Unknown");
}

TEST(SXReportingUtilityInternalBuild, AskedOnceEvenFromManyThreads) {
  auto device = std::make_shared<FakeDeviceProperties>(SXValue{{"InternalBuild", true}});
  SXPlatform platform;
  platform.device = device;
  SXReportingEnvironment env(platform);
  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] { EXPECT_TRUE(SXReportingUtilityIsInternalBuild(env)); });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(device->queries("InternalBuild"), 1);
}

TEST(SXReportingUtilityInternalBuild, OnlyATrueBooleanCounts) {
  for (const SXValue& props : {SXValue::object(), SXValue{{"InternalBuild", false}},
                               SXValue{{"InternalBuild", 1}}, SXValue{{"InternalBuild", "YES"}}}) {
    SXPlatform platform;
    platform.device = std::make_shared<FakeDeviceProperties>(props);
    SXReportingEnvironment env(platform);
    EXPECT_FALSE(SXReportingUtilityIsInternalBuild(env)) << props.dump();
  }
}

TEST(SXReportingUtilityWait, FlagAlreadySetReturnsAtOnceWithoutLogging) {
  FakeLog log;
  SXReportingCondition condition;
  bool done = true;
  EXPECT_TRUE(SXReportingUtilityWait(condition, done, "waiting", "failed", log, nullptr, 5.0));
  EXPECT_TRUE(log.lines().empty());
}

TEST(SXReportingUtilityWait, SignalWithoutFlagRestartsThePassThenTimesOut) {
  FakeLog log;
  SXReportingCondition condition;
  bool done = false;
  std::thread signaller([&] {
    // Wait until the first pass is under way, then wake it without setting the flag.
    while (log.count("waiting") < 1) std::this_thread::yield();
    std::lock_guard lock(condition.mutex);
    condition.signal();
  });
  EXPECT_FALSE(SXReportingUtilityWait(condition, done, "waiting", "failed", log, nullptr, 0.3));
  signaller.join();
  EXPECT_EQ(log.messages(),
            (std::vector<std::string>{"waiting", "continuing", "waiting", "failed"}));
  EXPECT_EQ(log.lines().back().level, SXLogLevel::kError);
}

TEST(SXReportingUtilityWait, FlagSetWhileWaitingReturnsTrue) {
  FakeLog log;
  SXReportingCondition condition;
  bool done = false;
  std::thread setter([&] {
    while (log.count("waiting") < 1) std::this_thread::yield();
    std::lock_guard lock(condition.mutex);
    done = true;
    condition.signal();
  });
  EXPECT_TRUE(SXReportingUtilityWait(condition, done, "waiting", "failed", log, nullptr, 30.0));
  setter.join();
  EXPECT_EQ(log.messages(), (std::vector<std::string>{"waiting", "continuing"}));
}
