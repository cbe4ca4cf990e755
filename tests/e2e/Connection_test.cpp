// The defaults switch through the real daemon. (Socket activation is the install test's, the
// end of client connections ChurnEndToEnd.)
#include <gtest/gtest.h>
#include <unistd.h>

#include "support/Daemon.h"

using namespace std::chrono_literals;

// The preferences live outside the configuration directory, as under the packaged unit; the
// daemon's flag and the tool's environment twin must name the same place.
TEST(ConnectionEndToEnd, DefaultsSwitchDisablesAndRestoresReporting) {
  SXTestTempDir state;
  const std::string preferences = state.file("preferences");
  TestDaemon daemon({.extraArgs = {"--preferences-dir", preferences}});
  ::setenv("SXREPORTING_PREFERENCES_DIR", preferences.c_str(), 1);
  auto client = daemon.client();
  auto other = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(42)));
  ASSERT_TRUE(replied(client->setServiceType(2, 42)));
  EXPECT_EQ(replied(client->status())["defaults"], nullptr);  // not read at start-up

  ASSERT_EQ(daemon.ctl({"defaults", "write", "disable_reporting", "--bool", "true"}), 0);
  ASSERT_EQ(daemon.ctl({"defaults", "write", "device_name", "bench"}), 0);
  ASSERT_TRUE(std::filesystem::exists(preferences + "/com.vendra.sonex.json"));
  EXPECT_FALSE(replied(client->sendMessage({{"a", 1}}, 3, 1, std::vector<int64_t>{42})));
  ASSERT_EQ(daemon.ctl({"notify", "com.vendra.sonex.reporting"}), 0);
  ASSERT_TRUE(
      waitUntil([&] { return !replied(client->status())["reportingEnabled"].get<bool>(); }));
  auto disabled = replied(client->sendMessage({{"a", 1}}, 3, 1, std::vector<int64_t>{42}));
  ASSERT_TRUE(disabled);
  EXPECT_EQ(*disabled, (SXError{"com.vendra.audio.reporting", 1}));
  EXPECT_EQ(replied(client->getServiceNameForReporterID(42)), 2);     // own map still answers
  EXPECT_EQ(replied(other->getServiceNameForReporterID(42)), 65535);  // other clients' are hidden

  ASSERT_EQ(daemon.ctl({"defaults", "write", "disable_reporting", "--bool", "false"}), 0);
  ASSERT_EQ(daemon.ctl({"notify", "com.vendra.sonex.reporting"}), 0);
  ASSERT_TRUE(waitUntil([&] { return replied(client->status())["reportingEnabled"].get<bool>(); }));
  EXPECT_FALSE(replied(client->sendMessage({{"a", 1}}, 3, 1, std::vector<int64_t>{42})));
  EXPECT_EQ(daemon.countInLog("re-reading sonex defaults"), 2u);
  // The send refused while reporting was off reached no store.
  EXPECT_EQ(daemon.waitForRows("fernreporting.db", "SELECT id FROM messages", 2).size(), 2u);

  // A post with nothing changed still reaches every session: the merged defaults travel in
  // the user info of the session's next server-reporting session.
  ASSERT_EQ(daemon.ctl({"notify", "com.vendra.sonex.reporting"}), 0);
  ASSERT_TRUE(daemon.waitForLog("re-reading sonex defaults", 3));
  auto start = client->startReportingSessionForID(42, kSXWaitForever);
  auto sessions = daemon.waitForRows("fernreporting.db", "SELECT user_info_json FROM sessions", 1);
  ASSERT_EQ(sessions.size(), 1u);
  SXValue userInfo = SXValue::parse(sessions[0]["user_info_json"].get<std::string>());
  EXPECT_EQ(userInfo["device_name"], "bench");
  EXPECT_EQ(userInfo["disable_reporting"], false);
  EXPECT_TRUE(replied(client->stopReportingSessionForID(42)));
  EXPECT_TRUE(start.get().value);
  ::unsetenv("SXREPORTING_PREFERENCES_DIR");
}
