#include <gtest/gtest.h>
#include <unistd.h>

#include <utility>

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
  EXPECT_EQ(line.requests[4].reporterID, 7);
  for (const auto& request : line.requests) {
    EXPECT_TRUE(request.json);
    EXPECT_EQ(request.socketPath, "/s");
    EXPECT_EQ(request.stateDir, "/st");
    EXPECT_EQ(request.configDir, "/cf");
    EXPECT_EQ(SXCtlTimeout(request), 2500ms);
  }
}

// The parts of a request the rows below check.
SXValue parts(const SXCtlRequest& r) {
  return {{"id", r.reporterID},
          {"type", r.serviceType},
          {"payload", r.payload},
          {"category", r.category},
          {"value", r.value},
          {"configured", r.configuration.has_value()},
          {"timeout", SXCtlTimeout(r).value_or(-1ms).count()},
          {"notification", r.notificationName},
          {"ids", r.reporterIDs ? SXValue(*r.reporterIDs) : SXValue("broadcast")},
          {"socket", SXCtlPaths(r).socketPath},
          {"preferences", SXCtlPaths(r).preferencesDirectory()}};
}

// Each command line and what some parts of its request must be.
TEST(SXCtlArgsTest, CommandsTakeTheirArguments) {
  const int64_t forever = kSXWaitForever.count();
  ::unsetenv("SXREPORTING_SOCKET");
  ::setenv("SXREPORTING_PREFERENCES_DIR", "/env", 1);  // which the flag overrides
  const std::pair<std::vector<std::string>, SXValue> rows[] = {
      {{"destroy", "010"}, {{"id", 10}}},  // decimal, whatever CLI11 makes of a leading zero
      {{"--socket", "/a", "list", "--socket=/b"}, {{"socket", "/b"}}},  // the later of two
      {{"--runtime-dir", "/r", "list"},
       {{"socket", "/r/com.vendra.audio.kitbench.reporting.service"}}},
      {{"--preferences-dir", "/p", "list"}, {{"preferences", "/p"}}},
      // Start waits without limit unless told; 0 is no limit; a limit is at least 1 ms.
      {{"start", "1"}, {{"timeout", forever}}},
      {{"create", "1"}, {{"timeout", 5000}}},
      {{"create", "1", "--timeout", "0"}, {{"timeout", forever}}},
      {{"create", "1", "--timeout", "0.0001"}, {{"timeout", 1}}},
      {{"set-type", "TEST", "42"}, {{"type", 11}}},  // names in any case
      {{"send", "--ids", "1,-2,3", "{\"k\": 1}"}, {{"ids", {1, -2, 3}}, {"payload", {{"k", 1}}}}},
      {{"send", "--ids", "", "{}"}, {{"ids", SXValue::array()}}},  // not a broadcast
      {{"send", "--broadcast", "--category", "0x08000003", "{}"},
       {{"ids", "broadcast"}, {"category", 0x08000003u}}},
      {{"configure", "--config", "null", "5"}, {{"configured", false}}},
      {{"notify", "--", "then"}, {{"notification", "then"}}},
      // Defaults values take their type from a flag that may follow them; "-5" is no option.
      {{"defaults", "write", "--int", "K", "-5"}, {{"value", -5}}},
      {{"defaults", "write", "K", "--bool", "NO"}, {{"value", false}}},
  };
  for (const auto& [args, expected] : rows) {
    const SXValue actual = parts(parse(args));
    for (const auto& [part, value] : expected.items()) {
      EXPECT_EQ(actual[part], value) << part << " of " << ::testing::PrintToString(args);
    }
  }
  ::unsetenv("SXREPORTING_PREFERENCES_DIR");
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

}  // namespace
