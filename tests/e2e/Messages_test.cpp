// A client's messages reaching the analytics store, the power log and the spool, and the
// defaults switch that turns them away.
#include <gtest/gtest.h>
#include <unistd.h>

#include "support/Daemon.h"

namespace {

const char* kEvents =
    "SELECT name, payload_json FROM events WHERE name LIKE 'com.vendra.sonex.%' "
    "AND name != 'com.vendra.sonex.sxreportingclientuptime' ORDER BY id";
const char* kSingles =
    "SELECT category, user_info_json, payload_json FROM messages WHERE session_id IS NULL "
    "ORDER BY id";

SXValue column(const SXValue& row, const char* name) {
  return SXValue::parse(row[name].get<std::string>());
}

}  // namespace

// The preferences live outside the configuration directory, as under the packaged unit; the
// daemon's flag and the tool's environment twin must name the same place.
TEST(MessagesEndToEnd, SendsReachEveryStoreUntilTheDefaultsSwitchDisablesReporting) {
  SXTestTempDir state;
  const std::string preferences = state.file("preferences");
  TestDaemon daemon({.extraArgs = {"--preferences-dir", preferences}});
  ::setenv("SXREPORTING_PREFERENCES_DIR", preferences.c_str(), 1);
  auto client = daemon.client();
  auto other = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(42)));
  ASSERT_TRUE(replied(client->setServiceType(2, 42)));
  EXPECT_EQ(replied(client->status())["defaults"], nullptr);  // not read at start-up

  // An addressed send to a created session lands in every store with every value kind.
  ASSERT_TRUE(replied(client->createReportingSession(7)));
  ASSERT_TRUE(
      replied(client->setConfiguration(SXValue{{"HostApplicationDisplayID", "player"}}, 7)));
  SXValue payload = {{"peak level", 1},
                     {"EngineOnTime", 12.5},
                     {"sxreporting_timestamp", 1000},
                     {"HostApplicationDisplayID", "not the session's"},
                     {"int", -5},
                     {"big", uint64_t{18446744073709551615u}},
                     {"float", 0.1},
                     {"nil", nullptr},
                     {"list", {1, "two", {{"three", true}}}},
                     {"bytes", SXValue::binary({0, 1, 255})}};
  EXPECT_FALSE(replied(client->sendMessage(payload, 3, 1, std::vector<int64_t>{7})));

  auto events = daemon.waitForRows("tallyvane.db", kEvents, 1);
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0]["name"], "com.vendra.sonex.Playback.Start");
  SXValue event = column(events[0], "payload_json");
  EXPECT_EQ(event["HostApplicationDisplayID"], "player");  // the session's wins
  EXPECT_EQ(event["peak level"], 1);  // the analytics event keeps the client's keys

  auto power =
      daemon.waitForRows("joulebook.db", "SELECT client_id, event, payload_json FROM entries", 1);
  ASSERT_EQ(power.size(), 1u);
  EXPECT_EQ(power[0]["client_id"], 28);
  EXPECT_EQ(power[0]["event"], "Flumen_Haptics");
  EXPECT_EQ(
      column(power[0], "payload_json"),
      (SXValue{{"EngineOnDuration", 12.5}, {"ApplicationName", "player"}, {"TimestampEnd", 1000}}));

  // Not started: the session sends it on as a standalone message with its own service type,
  // every value unchanged but for the keys' spaces.
  auto singles = daemon.waitForRows("fernreporting.db", kSingles, 1);
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0]["category"], 3);
  EXPECT_EQ(column(singles[0], "user_info_json")["ServiceName"], "unknown");
  SXValue expected = payload;
  expected["peak_level"] = expected["peak level"];
  expected.erase("peak level");
  expected["bytes"] = SXValue::parse(SXValue(payload["bytes"]).dump());
  EXPECT_EQ(column(singles[0], "payload_json"), expected);

  // With no session started, the tool's broadcast goes standalone; no IDs or unknown ones reach
  // nothing, so it is the only row after the first.
  EXPECT_FALSE(replied(client->sendMessage({{"a", 1}}, 3, 1, std::vector<int64_t>{})));
  EXPECT_FALSE(replied(client->sendMessage({{"a", 1}}, 3, 1, std::vector<int64_t>{0, 99})));
  EXPECT_EQ(daemon.ctl({"send", "--broadcast", "--category", "0x08000003", "{\"a b\":\"c d\"}"}),
            0);
  singles = daemon.waitForRows("fernreporting.db", kSingles, 2);
  ASSERT_EQ(singles.size(), 2u);
  EXPECT_EQ(singles[1]["category"], 3);
  EXPECT_EQ(column(singles[1], "user_info_json"),
            (SXValue{{"ClientName", "com.vendra.sonex"}, {"ServiceName", "standalone"}}));
  EXPECT_EQ(column(singles[1], "payload_json"), (SXValue{{"a_b", "c d"}}));
  EXPECT_EQ(daemon.rows("tallyvane.db", kEvents).size(), 1u);  // standalone skips the bridges
  SXValue counters = replied(client->status())["counters"];
  EXPECT_EQ(counters["messages_received"], 4);
  EXPECT_EQ(counters["messages_delivered"],
            (SXValue{{"tallyvane", 1}, {"joulebook", 1}, {"fernreporting", 2}}));

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
  std::string out;
  EXPECT_EQ(daemon.ctl({"send", "--broadcast", "{}"}, &out), 1);
  EXPECT_EQ(out,
            "not delivered: reporting is disabled (domain com.vendra.audio.reporting, code 1)\n");
  EXPECT_EQ(replied(client->getServiceNameForReporterID(42)), 2);     // own map still answers
  EXPECT_EQ(replied(other->getServiceNameForReporterID(42)), 65535);  // other clients' are hidden

  ASSERT_EQ(daemon.ctl({"defaults", "write", "disable_reporting", "--bool", "false"}), 0);
  ASSERT_EQ(daemon.ctl({"notify", "com.vendra.sonex.reporting"}), 0);
  ASSERT_TRUE(waitUntil([&] { return replied(client->status())["reportingEnabled"].get<bool>(); }));
  EXPECT_FALSE(replied(client->sendMessage({{"a", 1}}, 3, 1, std::vector<int64_t>{42})));
  // The send refused while reporting was off reached no store.
  EXPECT_EQ(daemon.waitForRows("fernreporting.db", "SELECT id FROM messages", 4).size(), 4u);

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
