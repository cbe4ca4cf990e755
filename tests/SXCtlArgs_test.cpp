#include "client/SXCtlArgs.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "common/SXServiceTypes.h"

using namespace std::chrono_literals;

namespace {

SXCtlRequest parse(std::vector<std::string> args) {
  SXCtlRequest request;
  std::string error;
  EXPECT_TRUE(SXCtlParse(args, request, error)) << error;
  return request;
}

std::string parseError(std::vector<std::string> args) {
  SXCtlRequest request;
  std::string error;
  EXPECT_FALSE(SXCtlParse(args, request, error)) << "parsed: " << request.command;
  return error;
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
}

TEST(SXCtlArgsTest, UsageErrorsSayWhatIsWrong) {
  EXPECT_EQ(parseError({}), "no command given; see sxreportctl --help");
  EXPECT_EQ(parseError({"frob"}), "unknown command 'frob'");
  EXPECT_EQ(parseError({"create"}), "usage: sxreportctl create ID");
  EXPECT_EQ(parseError({"create", "1", "2"}), "usage: sxreportctl create ID");
  EXPECT_EQ(parseError({"create", "x1"}), "not a reporter ID: 'x1'");
  EXPECT_EQ(parseError({"create", "99999999999999999999"}),
            "not a reporter ID: '99999999999999999999'");
  EXPECT_EQ(parseError({"create", "--config", "{}", "1"}), "create has no option --config");
  EXPECT_NE(parseError({"--ids", "1", "send", "{}"}).find("unknown option --ids"),
            std::string::npos);
  EXPECT_EQ(parseError({"list", "--socket"}), "--socket needs a value");
  EXPECT_EQ(parseError({"list", "--json=yes"}), "--json takes no value");
  EXPECT_EQ(parseError({"list", "--timeout", "-1"}), "not a time-out in seconds: '-1'");
  EXPECT_EQ(parseError({"list", "--timeout", "soon"}), "not a time-out in seconds: 'soon'");
  EXPECT_EQ(parseError({"notify", "a/b"}), "not a notification name: 'a/b'");
  EXPECT_EQ(parseError({"notify", ".."}), "not a notification name: '..'");
}

TEST(SXCtlArgsTest, ServiceTypesByNumberOrName) {
  EXPECT_EQ(parse({"set-type", "telephony", "42"}).serviceType, 2);
  EXPECT_EQ(parse({"set-type", "TEST", "1"}).serviceType, 11);
  EXPECT_EQ(parse({"set-type", "65535", "1"}).serviceType, 65535);
  EXPECT_EQ(parse({"set-type", "unknown", "1"}).serviceType, 65535);
  EXPECT_EQ(parse({"set-type", "12", "1"}).serviceType, 12);
  EXPECT_NE(parseError({"set-type", "65536", "1"}).find("not a service type"), std::string::npos);
  EXPECT_NE(parseError({"set-type", "-1", "1"}).find("not a service type"), std::string::npos);
  EXPECT_NE(parseError({"set-type", "bogus", "1"}).find("not a service type"), std::string::npos);

  for (SXReportingServiceType type : {0, 1, 11, 12, 65534, 65535}) {
    EXPECT_EQ(SXServiceTypeFromText(SXServiceTypeName(type)), type);
  }
  EXPECT_EQ(SXServiceTypeName(12), "servicetype12");
}

TEST(SXCtlArgsTest, SendTakesDefaultsIdListsAndBroadcast) {
  auto r = parse({"send", "--ids", "1,-2,3", "{\"k\": 1}"});
  EXPECT_EQ(r.category, 3u);
  EXPECT_EQ(r.messageType, 1);
  EXPECT_EQ(r.reporterIDs, (std::vector<int64_t>{1, -2, 3}));
  EXPECT_EQ(r.payload, (SXValue{{"k", 1}}));

  r = parse({"send", "--ids", "", "--category", "0x08000003", "--type=4", "{}"});
  ASSERT_TRUE(r.reporterIDs.has_value());  // an empty list, which is not a broadcast
  EXPECT_TRUE(r.reporterIDs->empty());
  EXPECT_EQ(r.category, 0x08000003u);
  EXPECT_EQ(r.messageType, 4);

  EXPECT_FALSE(parse({"send", "--broadcast", "{}"}).reporterIDs.has_value());

  EXPECT_NE(parseError({"send", "{}"}).find("--broadcast"), std::string::npos);
  EXPECT_NE(parseError({"send", "--broadcast", "--ids", "1", "{}"}).find("either"),
            std::string::npos);
  EXPECT_EQ(parseError({"send", "--ids", "1,,2", "{}"}), "not a reporter ID: ''");
  EXPECT_EQ(parseError({"send", "--broadcast", "--type", "65536", "{}"}),
            "not a message type: '65536' (0 to 65535)");
  EXPECT_EQ(parseError({"send", "--broadcast", "--category", "4294967296", "{}"}),
            "not a category: '4294967296' (0 to 4294967295)");
  EXPECT_EQ(parseError({"send", "--broadcast", "[1]"}), "the payload must be a JSON object");
  EXPECT_EQ(parseError({"send", "--broadcast", "{"}), "the payload is not valid JSON: {");
}

TEST(SXCtlArgsTest, ConfigureTakesAnObjectOrNull) {
  EXPECT_EQ(parse({"configure", "--config", "{\"a\":1}", "5"}).configuration, (SXValue{{"a", 1}}));
  auto cleared = parse({"configure", "--config", "null", "5"});
  EXPECT_FALSE(cleared.configuration.has_value());
  EXPECT_EQ(cleared.reporterID, 5);
  EXPECT_NE(parseError({"configure", "5"}).find("needs --config"), std::string::npos);
  EXPECT_EQ(parseError({"configure", "--config", "[1]", "5"}),
            "--config must be a JSON object or null");
}

TEST(SXCtlArgsTest, DefaultsActionsAndTypedValues) {
  auto read = parse({"defaults", "read"});
  EXPECT_EQ(read.defaultsAction, "read");
  EXPECT_FALSE(read.key.has_value());
  EXPECT_EQ(parse({"defaults", "read", "K"}).key, "K");
  EXPECT_EQ(parse({"defaults", "write", "K", "v"}).value, "v");
  EXPECT_EQ(parse({"defaults", "write", "--int", "K", "-5"}).value, -5);
  EXPECT_EQ(parse({"defaults", "write", "--bool", "K", "NO"}).value, false);
  EXPECT_EQ(parse({"defaults", "write", "--string", "K", "12"}).value, "12");
  EXPECT_EQ(parse({"defaults", "delete", "K"}).key, "K");

  EXPECT_NE(parseError({"defaults", "write", "K"}).find("usage"), std::string::npos);
  EXPECT_NE(parseError({"defaults", "delete"}).find("usage"), std::string::npos);
  EXPECT_NE(parseError({"defaults", "erase", "K"}).find("usage"), std::string::npos);
  EXPECT_NE(parseError({"defaults", "read", "--int", "K"}).find("usage"), std::string::npos);
  EXPECT_EQ(parseError({"defaults", "write", "--bool", "K", "maybe"}),
            "not a boolean: 'maybe' (true, false, yes, no, 1 or 0)");
  EXPECT_EQ(parseError({"defaults", "write", "--int", "--bool", "K", "1"}),
            "give at most one of --bool, --int and --string");
}

TEST(SXCtlArgsTest, EventsFilters) {
  auto r = parse({"events", "--name", "com.x", "--limit", "3"});
  EXPECT_EQ(r.eventName, "com.x");
  EXPECT_EQ(r.limit, 3);
  EXPECT_FALSE(parse({"events"}).limit.has_value());
  EXPECT_EQ(parseError({"events", "--limit", "-1"}), "--limit must not be negative");
  EXPECT_EQ(parse({"events", "--since", "2026-11-25T06:30:15Z"}).since, 1795588215.0);
  EXPECT_FALSE(parse({"events"}).since.has_value());
}

TEST(SXCtlArgsTest, SinceTakesUtcTimesAndAges) {
  const double now = 1795588215.5;  // 2026-11-25T06:30:15.5Z
  const std::pair<const char*, double> good[] = {
      {"2026-11-25T06:30:15Z", 1795588215},
      {"2026-11-25T06:30:15", 1795588215},
      {"2026-11-25 06:30", 1795588200},
      {"2026-11-25", 1795564800},
      {"90s", now - 90},
      {"10m", now - 600},
      {"2h", now - 7200},
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
  std::vector<SXCtlRequest> chain;
  std::string error;
  ASSERT_TRUE(SXCtlParseChain({"create", "42", "then", "--json", "set-type", "telephony", "42",
                               "then", "start", "42", "--socket", "/s"},
                              chain, error))
      << error;
  ASSERT_EQ(chain.size(), 3u);
  EXPECT_EQ(chain[1].serviceType, 2);
  for (const auto& request : chain) {
    EXPECT_TRUE(request.json);
    EXPECT_EQ(request.socketPath, "/s");
  }
  ASSERT_TRUE(SXCtlParseChain({"notify", "--", "then"}, chain, error)) << error;
  EXPECT_EQ(chain.at(0).notificationName, "then");

  EXPECT_FALSE(SXCtlParseChain({"list", "then"}, chain, error));
  EXPECT_EQ(error, "'then' must stand between two commands");
  EXPECT_FALSE(SXCtlParseChain({"list", "then", "then", "list"}, chain, error));
  EXPECT_FALSE(SXCtlParseChain({"list", "then", "create"}, chain, error));
  EXPECT_EQ(error, "usage: sxreportctl create ID");
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
  EXPECT_EQ(SXCtlPaths(parse({"--state-dir", "/st", "list"})).stateDir, "/st");

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
