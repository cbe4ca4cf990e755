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

TEST(SXCtlArgsTest, GlobalOptionsGoAnywhereInEitherForm) {
  auto r = parse({"--socket", "/tmp/s", "create", "--json", "-42", "--timeout=2.5"});
  EXPECT_EQ(r.command, "create");
  EXPECT_EQ(r.reporterID, -42);
  EXPECT_TRUE(r.json);
  EXPECT_EQ(r.socketPath, "/tmp/s");
  EXPECT_EQ(SXCtlTimeout(r), 2500ms);

  r = parse({"get-type", "--state-dir=/st", "--config-dir", "/cf", "--", "7"});
  EXPECT_EQ(r.reporterID, 7);
  EXPECT_EQ(r.stateDir, "/st");
  EXPECT_EQ(r.configDir, "/cf");
  // Decimal, whatever CLI11 would make of a leading zero; the later of two values.
  EXPECT_EQ(parse({"destroy", "010"}).reporterID, 10);
  EXPECT_EQ(parse({"--socket", "/a", "list", "--socket=/b"}).socketPath, "/b");
}

// Everything a command line can end with instead of a run: one line naming what is wrong
// (status 2), or the help or version (status 0). One row per kind of check.
TEST(SXCtlArgsTest, UsageErrorsHelpAndVersion) {
  struct Row {
    std::vector<std::string> args;
    int status;
    std::string text;  // how the error line begins, a part of the help
  };
  const std::string notID = "ID: not a reporter ID (a signed 64-bit number): ";
  const Row rows[] = {
      {{}, 2, "no command given; see sxreportctl --help"},
      {{"frob"}, 2, "unknown command 'frob'"},
      {{"create"}, 2, "create: ID is required"},
      {{"create", "1", "2"}, 2, "create: The following argument was not expected: 2"},
      {{"create", "x1"}, 2, "create: " + notID + "'x1'"},
      {{"create", "99999999999999999999"}, 2, "create: " + notID + "'99999999999999999999'"},
      // An unknown option is named, not what its value did to the arguments after it.
      {{"create", "--config", "{}", "1"}, 2, "create: unknown option --config"},
      {{"--ids", "1", "send", "{}"}, 2, "unknown option --ids (a command's own options follow it)"},
      {{"status", "--metrics=1"}, 2, "status: metrics was given a disallowed flag override"},
      {{"list", "--socket"}, 2, "list: --socket: 1 required PATH missing"},
      {{"list", "--timeout", "inf"}, 2, "list: --timeout: not a time-out in seconds: 'inf'"},
      {{"set-type", "65536", "1"}, 2, "set-type: TYPE: not a service type: '65536' (0-65535"},
      {{"send", "{}"}, 2, "send: send needs either --ids ID,ID,... (--ids '' for none)"},
      {{"send", "--broadcast", "--ids", "1", "{}"}, 2, "send: send needs either"},
      {{"send", "--ids", "1,,2", "{}"}, 2, "send: --ids: not a reporter ID"},
      {{"send", "--broadcast", "--category", "4294967296", "{}"},
       2,
       "send: --category: not a category (0 to 4294967295): '4294967296'"},
      {{"send", "--broadcast", "[1]"}, 2, "send: PAYLOAD_JSON: not a JSON object"},
      {{"send", "--broadcast", "{"}, 2, "send: PAYLOAD_JSON: not valid JSON: {"},
      {{"configure", "5"}, 2, "configure: --config is required"},
      {{"defaults", "erase", "K"}, 2, "defaults: unknown command 'erase'"},
      {{"defaults", "write", "--bool", "K", "maybe"}, 2, "defaults write: VALUE: not a boolean"},
      {{"defaults", "write", "--int", "--bool", "K", "1"}, 2, "defaults write: --bool excludes"},
      {{"list", "then"}, 2, "'then' must stand between two commands"},
      {{"list", "then", "create"}, 2, "create: ID is required"},
      // The help of the command it follows, wherever in a chain.
      {{"list", "then", "create", "1", "--help"}, 0, "Usage: sxreportctl create [OPTIONS] ID\n"},
      {{"list", "--version"}, 0, "sxreportctl "},
  };
  for (const auto& row : rows) {
    SXCtlCommandLine line = SXCtlParseChain(row.args);
    SCOPED_TRACE(testing::PrintToString(row.args));
    EXPECT_EQ(line.exitStatus, row.status);
    EXPECT_TRUE(line.requests.empty());
    if (row.status == 0) {
      EXPECT_NE(line.text.find(row.text), std::string::npos) << line.text;
    } else {
      EXPECT_TRUE(line.text.starts_with("sxreportctl: " + row.text)) << line.text;
      EXPECT_EQ(std::count(line.text.begin(), line.text.end(), '\n'), 1) << line.text;
    }
  }
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

TEST(SXCtlArgsTest, ChainsShareGlobalOptions) {
  SXCtlCommandLine line = SXCtlParseChain({"create", "42", "then", "--json", "set-type",
                                           "telephony", "42", "then", "start", "42", "--socket",
                                           "/s", "then", "defaults", "read", "--timeout", "1"});
  ASSERT_FALSE(line.exitStatus) << line.text;
  ASSERT_EQ(line.requests.size(), 4u);
  EXPECT_EQ(line.requests[1].serviceType, 2);
  EXPECT_EQ(line.requests[3].defaultsAction, "read");
  for (const auto& request : line.requests) {
    EXPECT_TRUE(request.json);
    EXPECT_EQ(request.socketPath, "/s");
    EXPECT_EQ(SXCtlTimeout(request), 1000ms);
  }
}

TEST(SXCtlArgsTest, StartWaitsWithoutLimitUnlessTold) {
  EXPECT_EQ(SXCtlTimeout(parse({"start", "1"})), kSXWaitForever);
  EXPECT_EQ(SXCtlTimeout(parse({"start", "1", "--timeout", "3"})), 3000ms);
  EXPECT_EQ(SXCtlTimeout(parse({"create", "1"})), 5000ms);
  EXPECT_EQ(SXCtlTimeout(parse({"create", "1", "--timeout", "0"})), kSXWaitForever);
  EXPECT_EQ(SXCtlTimeout(parse({"create", "1", "--timeout", "0.0001"})), 1ms);
}

TEST(SXCtlArgsTest, SocketAndPreferencesFollowTheirDirectoriesUnlessGiven) {
  ::unsetenv("SXREPORTING_SOCKET");
  auto paths = SXCtlPaths(parse({"--runtime-dir", "/r", "list"}));
  EXPECT_EQ(paths.runtimeDir, "/r");
  EXPECT_EQ(paths.socketPath, "/r/com.vendra.audio.kitbench.reporting.service");
  paths = SXCtlPaths(parse({"--runtime-dir", "/r", "--socket", "/s", "list"}));
  EXPECT_EQ(paths.socketPath, "/s");

  ::unsetenv("SXREPORTING_PREFERENCES_DIR");
  auto preferences = [](std::vector<std::string> args) {
    return SXCtlPaths(parse(std::move(args))).preferencesDirectory();
  };
  // Root's follow the state directory, where the system's service keeps them.
  const std::string byDefault = ::geteuid() == 0 ? "/s/preferences" : "/c/preferences";
  EXPECT_EQ(preferences({"--config-dir", "/c", "--state-dir", "/s", "list"}), byDefault);
  EXPECT_EQ(preferences({"--config-dir", "/c", "--preferences-dir", "/p", "list"}), "/p");
  ::setenv("SXREPORTING_PREFERENCES_DIR", "/env", 1);
  EXPECT_EQ(preferences({"--config-dir", "/c", "list"}), "/env");
  EXPECT_EQ(preferences({"--preferences-dir", "/p", "list"}), "/p");
  ::unsetenv("SXREPORTING_PREFERENCES_DIR");
}

}  // namespace
