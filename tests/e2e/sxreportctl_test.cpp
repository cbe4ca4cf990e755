// The sxreportctl executable against the daemon, and its own files in the daemon's directories.
// (How `status` prints, CtlStatus tests; that it answers, the install test.)
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <regex>

#include "support/Daemon.h"

namespace {

class SxreportctlTest : public ::testing::Test {
 protected:
  struct Run {
    int status = -1;
    std::string out;  // with the errors
  };
  Run run(const std::vector<std::string>& args) {
    Run result;
    result.status = daemon_.ctl(args, &result.out);
    return result;
  }

  TestDaemon daemon_{{.extraArgs = {"--max-reporter-ids", "1"}}};
  SXTestTempDir empty_;
};

// The service answers no stop of reporter 0, answers false to the start of a session nobody
// created, refuses more reporter IDs than its limit and exits with status 2 on kill. A command
// line that cannot run is one line naming what is wrong (status 2), or the help or version.
TEST_F(SxreportctlTest, ExitStatusTellsEachOutcomeApart) {
  struct Row {
    std::vector<std::string> args;
    int status;
    std::string out;  // a part of the output; for status 2, how the one line begins
  };
  const std::string notID = "ID: not a reporter ID (a signed 64-bit number): ";
  const Row rows[] = {
      // Chained commands share one connection, and so its sessions, and stop at a failure.
      {{"create", "42", "then", "set-type", "telephony", "42", "then", "get-type", "42", "then",
        "start", "43", "then", "create", "1"},
       1,
       "true\ntrue\n2 (telephony)\nfalse\n"},
      {{"--timeout", "0.2", "stop", "0", "then", "create", "1"},
       4,
       "stop: the service sent no reply within 0.2 s\n"},
      {{"send", "--ids", "", "{\"k\":1}"}, 0, "delivered\n"},
      {{}, 2, "no command given; see sxreportctl --help"},
      {{"frob"}, 2, "unknown command 'frob'"},
      {{"create", "x1"}, 2, "create: " + notID + "'x1'"},
      // An unknown option is named, not what its value did to the arguments after it.
      {{"create", "--config", "{}", "1"}, 2, "create: unknown option --config"},
      {{"--ids", "1", "send", "{}"}, 2, "unknown option --ids (a command's own options follow it)"},
      {{"status", "--metrics=1"}, 2, "status: metrics was given a disallowed flag override"},
      {{"list", "--timeout", "inf"}, 2, "list: --timeout: not a time-out in seconds: 'inf'"},
      {{"set-type", "65536", "1"}, 2, "set-type: TYPE: not a service type: '65536' (0-65535"},
      {{"send", "{}"}, 2, "send: send needs either --ids ID,ID,... (--ids '' for none)"},
      {{"send", "--broadcast", "[1]"}, 2, "send: PAYLOAD_JSON: not a JSON object"},
      {{"configure", "5"}, 2, "configure: --config is required"},
      {{"list", "then"}, 2, "'then' must stand between two commands"},
      // The help of the command it follows, wherever in a chain.
      {{"list", "then", "create", "1", "--help"}, 0, "Usage: sxreportctl create [OPTIONS] ID\n"},
      {{"--socket", empty_.file("nothing"), "list"}, 3, "cannot connect"},
      {{"defaults", "read", "Name"}, 5, "has no value for Name"},
      {{"send", "--ids", "1,2", "{}"}, 6, "more than the limit of 1"},
      {{"--state-dir", empty_.path(), "events"}, 7, "no analytics store"},
      {{"kill"}, 0, "the service closed the connection\n"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(testing::PrintToString(row.args));
    Run result = run(row.args);
    EXPECT_EQ(result.status, row.status) << result.out;
    if (row.status != 2) {
      EXPECT_NE(result.out.find(row.out), std::string::npos) << result.out;
      continue;
    }
    EXPECT_TRUE(result.out.starts_with("sxreportctl: " + row.out)) << result.out;
    EXPECT_EQ(std::count(result.out.begin(), result.out.end(), '\n'), 1) << result.out;
  }
  EXPECT_EQ(daemon_.waitForExit(), 2);  // and never replied
  EXPECT_TRUE(daemon_.waitForLog("DESTROYING SERVICE"));
  EXPECT_TRUE(std::regex_match(run({"list", "--version"}).out,
                               std::regex("sxreportctl [0-9]+\\.[0-9]+\\.[0-9]+\n")));
}

TEST_F(SxreportctlTest, DefaultsRoundTripThroughTheDomainFile) {
  EXPECT_EQ(run({"defaults", "write", "--bool", "ReportingEnabled", "no"}).status, 0);
  EXPECT_EQ(run({"defaults", "write", "--int", "Level", "3"}).status, 0);
  EXPECT_EQ(run({"defaults", "write", "Name", "x"}).status, 0);
  EXPECT_EQ(run({"defaults", "delete", "Name"}).status, 0);

  // Root's preferences follow the state directory, others' the configuration directory.
  const std::string file = daemon_.dir(std::string(::geteuid() == 0 ? "lib" : "etc") +
                                       "/preferences/com.vendra.sonex.json");
  EXPECT_EQ(SXValue::parse(SXTestReadFile(file)),
            (SXValue{{"Level", 3}, {"ReportingEnabled", false}}));
  EXPECT_EQ(run({"defaults", "read", "ReportingEnabled"}).out, "0\n");
  EXPECT_EQ(run({"--json", "defaults", "read"}).out, "{\"Level\":3,\"ReportingEnabled\":false}\n");
}

TEST_F(SxreportctlTest, EventsReadsTheAnalyticsStore) {
  SXTestExec(empty_.file("tallyvane.db"),
             "CREATE TABLE events(id INTEGER PRIMARY KEY, time REAL, name TEXT, payload_json TEXT);"
             "INSERT INTO events VALUES (1, 10.5, 'a', '{\"n\":1}');"
             "INSERT INTO events VALUES (2, 11.0, 'b', '{}');"
             "INSERT INTO events VALUES (3, 12.25, 'a', '{\"n\":3}');");

  auto events = [&](std::vector<std::string> args) {
    args.insert(args.begin(), {"--state-dir", empty_.path()});
    return run(args).out;
  };
  EXPECT_EQ(events({"events"}),
            "1  10.500  a  {\"n\":1}\n2  11.000  b  {}\n3  12.250  a  {\"n\":3}\n");
  EXPECT_EQ(events({"events", "--name", "a", "--limit", "1"}), "3  12.250  a  {\"n\":3}\n");
  EXPECT_EQ(events({"events", "--since", "1970-01-01T00:00:11Z", "--name", "a"}),
            "3  12.250  a  {\"n\":3}\n");
  EXPECT_EQ(
      SXValue::parse(events({"--json", "events", "--name", "b"})),
      SXValue::array({{{"id", 2}, {"time", 11.0}, {"name", "b"}, {"payload", SXValue::object()}}}));
}

}  // namespace
