#include <gtest/gtest.h>
#include <unistd.h>

#include "tools/sxreportctl/CtlArgs.h"

using namespace std::chrono_literals;

namespace {

SXCtlRequest parse(std::vector<std::string> args) {
  SXCtlCommandLine line = SXCtlParseChain(args);
  EXPECT_FALSE(line.exitStatus) << line.text;
  return line.requests.empty() ? SXCtlRequest() : line.requests[0];
}

// Global options go anywhere in a chain, in either form, and hold for every command of it.
TEST(SXCtlArgsTest, GlobalOptionsGoAnywhereAndHoldForTheWholeChain) {
  SXCtlCommandLine line =
      SXCtlParseChain({"create",        "-42",  "then",     "--json",          "set-type",
                       "telephony",     "42",   "then",     "start",           "42",
                       "--socket",      "/s",   "then",     "defaults",        "read",
                       "--timeout=2.5", "then", "get-type", "--state-dir=/st", "--config-dir",
                       "/cf",           "--",   "7"});
  ASSERT_FALSE(line.exitStatus) << line.text;
  ASSERT_EQ(line.requests.size(), 5u);
  EXPECT_EQ(line.requests[0].reporterID, -42);
  EXPECT_EQ(line.requests[1].serviceType, 2);
  EXPECT_EQ(line.requests[3].defaultsAction, "read");
  EXPECT_EQ(line.requests[4].reporterID, 7);
  for (const auto& request : line.requests) {
    EXPECT_TRUE(request.json);
    EXPECT_EQ(request.socketPath, "/s");
    EXPECT_EQ(request.stateDir, "/st");
    EXPECT_EQ(request.configDir, "/cf");
    EXPECT_EQ(SXCtlTimeout(request), 2500ms);
  }
  // Decimal, whatever CLI11 would make of a leading zero; the later of two values.
  EXPECT_EQ(parse({"destroy", "010"}).reporterID, 10);
  EXPECT_EQ(parse({"--socket", "/a", "list", "--socket=/b"}).socketPath, "/b");
  // Start waits without limit unless told; 0 is no limit; a limit is at least 1 ms.
  EXPECT_EQ(SXCtlTimeout(parse({"start", "1"})), kSXWaitForever);
  EXPECT_EQ(SXCtlTimeout(parse({"start", "1", "--timeout", "3"})), 3000ms);
  EXPECT_EQ(SXCtlTimeout(parse({"create", "1"})), 5000ms);
  EXPECT_EQ(SXCtlTimeout(parse({"create", "1", "--timeout", "0"})), kSXWaitForever);
  EXPECT_EQ(SXCtlTimeout(parse({"create", "1", "--timeout", "0.0001"})), 1ms);
}

TEST(SXCtlArgsTest, CommandsTakeTheirArguments) {
  EXPECT_EQ(parse({"set-type", "TEST", "42"}).serviceType, 11);  // names in any case
  EXPECT_EQ(parse({"set-type", "12", "42"}).serviceType, 12);
  auto r = parse({"send", "--ids", "1,-2,3", "{\"k\": 1}"});
  EXPECT_EQ(r.reporterIDs, (std::vector<int64_t>{1, -2, 3}));
  EXPECT_EQ(r.payload, (SXValue{{"k", 1}}));

  r = parse({"send", "--ids", "", "--category", "0x08000003", "--type=010", "{}"});
  ASSERT_TRUE(r.reporterIDs.has_value());  // an empty list, which is not a broadcast
  EXPECT_TRUE(r.reporterIDs->empty());
  EXPECT_EQ(r.category, 0x08000003u);
  EXPECT_EQ(r.messageType, 10);
  EXPECT_FALSE(parse({"send", "--broadcast", "{}"}).reporterIDs.has_value());

  auto cleared = parse({"configure", "--config", "null", "5"});
  EXPECT_FALSE(cleared.configuration.has_value());
  EXPECT_EQ(cleared.reporterID, 5);
  EXPECT_EQ(parse({"notify", "--", "then"}).notificationName, "then");

  // Defaults values take their type from a flag that may follow them; "-5" is no option.
  EXPECT_FALSE(parse({"defaults", "read"}).key.has_value());
  EXPECT_EQ(parse({"defaults", "write", "--int", "K", "-5"}).value, -5);
  EXPECT_EQ(parse({"defaults", "write", "K", "--bool", "NO"}).value, false);
  auto typed = parse({"defaults", "write", "--string", "K", "12"});
  EXPECT_EQ(typed.key, "K");
  EXPECT_EQ(typed.value, "12");
}

TEST(SXCtlArgsTest, SinceTakesUtcTimesAndAges) {
  const double now = 1795588215.5;  // 2026-11-25T06:30:15.5Z
  const std::pair<const char*, double> good[] = {
      {"2026-11-25T06:30:15Z", 1795588215},
      {"2026-11-25 06:30", 1795588200},
      {"2026-11-25", 1795564800},
      {"90s", now - 90},
      {"1.5d", now - 129600},
  };
  for (const auto& [text, expected] : good) {
    double since = 0;
    std::string error;
    EXPECT_TRUE(SXCtlParseSince(text, now, since, error)) << text << ": " << error;
    EXPECT_EQ(since, expected) << text;
  }
  for (const char* bad : {"", "yesterday", "10", "10w", "-5m", "2026-11-25T25:00", "2026-13-01",
                          "2026-11-25T06:30:15+02:00", "2026-11-25x"}) {
    double since = 0;
    std::string error;
    EXPECT_FALSE(SXCtlParseSince(bad, now, since, error)) << bad;
    EXPECT_NE(error.find("not a time: '" + std::string(bad) + "'"), std::string::npos) << error;
  }
}

TEST(SXCtlArgsTest, SocketFollowsTheRuntimeDirectoryAndFlagsWin) {
  ::unsetenv("SXREPORTING_SOCKET");
  auto paths = SXCtlPaths(parse({"--runtime-dir", "/r", "list"}));
  EXPECT_EQ(paths.runtimeDir, "/r");
  EXPECT_EQ(paths.socketPath, "/r/com.vendra.audio.kitbench.reporting.service");
  paths = SXCtlPaths(parse({"--runtime-dir", "/r", "--socket", "/s", "list"}));
  EXPECT_EQ(paths.socketPath, "/s");

  // The flag wins over the variable. (The default, root's under the state directory, and the
  // variable alone, the end-to-end defaults tests use.)
  ::setenv("SXREPORTING_PREFERENCES_DIR", "/env", 1);
  EXPECT_EQ(SXCtlPaths(parse({"--preferences-dir", "/p", "list"})).preferencesDirectory(), "/p");
  ::unsetenv("SXREPORTING_PREFERENCES_DIR");
}

}  // namespace
