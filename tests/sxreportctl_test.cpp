// The sxreportctl executable against a fake service and its files in a temporary directory.
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/wait.h>

#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>

#include "fakes/FakeRpcServer.h"
#include "support/Daemon.h"

using namespace sxr::method;
using Answer = FakeRpcServer::Answer;

namespace {

struct CtlRun {
  int status = -1;
  std::string out;
  std::string err;
};

std::string slurp(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

class SxreportctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!std::filesystem::exists(SXR_CTL_PATH)) GTEST_SKIP() << "sxreportctl not built";
  }

  // Runs the tool with every directory inside the server's temporary directory.
  CtlRun run(const std::vector<std::string>& args) {
    const std::string out = server_.directory() + "/out", err = server_.directory() + "/err";
    int raw = std::system((command(args) + " >" + out + " 2>" + err).c_str());
    return {WIFEXITED(raw) ? WEXITSTATUS(raw) : -1, slurp(out), slurp(err)};
  }
  std::string command(const std::vector<std::string>& args) {
    const std::string& dir = server_.directory();
    std::string command = std::string(SXR_CTL_PATH) + " --socket " +
                          shellQuoted(server_.socketPath()) + " --state-dir " + shellQuoted(dir) +
                          " --config-dir " + shellQuoted(dir) + " --runtime-dir " +
                          shellQuoted(dir);
    for (const auto& arg : args) command += " " + shellQuoted(arg);
    return command;
  }

  FakeRpcServer server_;
};

TEST_F(SxreportctlTest, SendPutsItsArgumentsOnTheWire) {
  server_.on(kSendMessage, [](const SXValue& params) {
    if (params[3].is_null())
      return Answer::reply({{"domain", kSXReportingErrorDomain}, {"code", 1}});
    return Answer::reply(nullptr);
  });
  CtlRun none = run({"send", "--ids", "", "{\"k\":1}"});
  EXPECT_EQ(none.status, 0);
  EXPECT_EQ(none.out, "delivered\n");
  CtlRun all = run({"send", "--broadcast", "--category", "0x08000003", "--type", "2", "{}"});
  EXPECT_EQ(all.status, 1);
  EXPECT_EQ(all.out,
            "not delivered: reporting is disabled (domain com.vendra.audio.reporting, code 1)\n");

  auto requests = server_.requests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0].params, SXValue::array({{{"k", 1}}, 3, 1, SXValue::array()}));
  EXPECT_EQ(requests[1].params, SXValue::array({SXValue::object(), 0x08000003, 2, nullptr}));
}

TEST_F(SxreportctlTest, ExitStatusTellsEachOutcomeApart) {
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  server_.on(kStart, [](auto&) { return Answer::reply(false); });
  server_.on(kSendMessage, [](auto&) {
    return Answer::reply({{"domain", kSXReportingErrorDomain}, {"code", 1}});
  });
  server_.on(kStop, [](auto&) { return Answer::none(); });
  server_.on(kSetServiceType, [](auto&) { return Answer::fail("service type above 65535"); });
  server_.on(kKillService, [&](auto&) {  // the service exits instead of replying
    server_.closeConnections();
    return Answer::none();
  });
  struct Row {
    std::vector<std::string> args;
    int status;
    std::string err;  // a part of stderr
  };
  const Row rows[] = {
      {{"create", "42"}, 0, ""},
      {{"kill"}, 0, ""},
      {{"--version"}, 0, ""},
      {{"start", "42"}, 1, ""},
      {{"send", "--broadcast", "{}"}, 1, ""},
      {{"create"}, 2, "create: ID is required"},
      {{"--socket", server_.directory() + "/nothing", "list"}, 3, "cannot connect"},
      {{"--timeout", "0.2", "stop", "0"}, 4, "stop: the service sent no reply within 0.2 s"},
      {{"defaults", "read", "Name"}, 5, "has no value for Name"},
      {{"set-type", "1", "5"}, 6, "service type above 65535"},
      {{"events"}, 7, "no analytics store"},
  };
  for (const auto& row : rows) {
    CtlRun result = run(row.args);
    EXPECT_EQ(result.status, row.status) << row.args.back() << ": " << result.err;
    EXPECT_NE(result.err.find(row.err), std::string::npos) << result.err;
  }
  EXPECT_TRUE(std::regex_match(run({"--version"}).out,
                               std::regex("sxreportctl [0-9]+\\.[0-9]+\\.[0-9]+\n")));
}

TEST_F(SxreportctlTest, ChainedCommandsShareOneConnectionAndStopAtAFailure) {
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  server_.on(kStart, [](auto&) { return Answer::reply(false); });
  server_.on(kStop, [](auto&) { return Answer::none(); });
  CtlRun chain = run({"create", "42", "then", "start", "42", "then", "create", "1"});
  EXPECT_EQ(chain.status, 1);
  EXPECT_EQ(chain.out, "true\nfalse\n");
  EXPECT_EQ(server_.connectionCount(), 1u);

  CtlRun stopped = run({"--timeout", "0.2", "stop", "0", "then", "create", "1"});
  EXPECT_EQ(stopped.status, 4);
  EXPECT_EQ(stopped.err, "stop: the service sent no reply within 0.2 s\n");
  EXPECT_EQ(server_.requests().size(), 3u);  // neither create 1 was sent
}

TEST_F(SxreportctlTest, StatusPrintsClientsSessionsDefaultsAndCounters) {
  SXValue status = SXValue::parse(R"({"reportingEnabled": true,
    "clients": [{"pid": 1234, "processName": "mixer", "uptimeSeconds": 12.5, "sessions": [
                  {"reporterID": 42, "serviceType": 2, "serviceName": "telephony", "started": true}]},
                {"pid": 99, "processName": null, "uptimeSeconds": null, "sessions": []}],
    "defaults": {"ReportingEnabled": true},
    "counters": {"messages_received": 7, "messages_delivered": {"fernreporting": 5}}})");
  server_.on(kStatus, [status](auto&) { return Answer::reply(status); });
  CtlRun result = run({"status"});
  EXPECT_EQ(result.status, 0);
  // Unknown parts say so, and nested counters are indented under their name.
  for (const char* line : {"  pid 1234 mixer, up 12.5 s\n    session 42: telephony (2), started\n",
                           "  pid 99 (unknown process), up unknown\n    (no sessions)\n",
                           "counters:\n  messages_delivered:\n    fernreporting = 5\n"}) {
    EXPECT_NE(result.out.find(line), std::string::npos) << result.out;
  }
}

TEST_F(SxreportctlTest, DefaultsRoundTripThroughTheDomainFile) {
  EXPECT_EQ(run({"defaults", "write", "--bool", "ReportingEnabled", "no"}).status, 0);
  EXPECT_EQ(run({"defaults", "write", "--int", "Level", "3"}).status, 0);
  EXPECT_EQ(run({"defaults", "write", "Name", "x"}).status, 0);
  EXPECT_EQ(run({"defaults", "delete", "Name"}).status, 0);

  const std::string file = server_.directory() + "/preferences/com.vendra.sonex.json";
  EXPECT_EQ(SXValue::parse(slurp(file)), (SXValue{{"Level", 3}, {"ReportingEnabled", false}}));
  EXPECT_EQ(run({"defaults", "read", "ReportingEnabled"}).out, "0\n");
  EXPECT_EQ(run({"--json", "defaults", "read"}).out, "{\"Level\":3,\"ReportingEnabled\":false}\n");

  std::ofstream(file) << "[not an object";
  EXPECT_EQ(run({"defaults", "write", "A", "b"}).status, 7);
  EXPECT_EQ(slurp(file), "[not an object");  // left as it was

  // Another preferences directory leaves the configuration directory's domain alone.
  const std::string elsewhere = server_.directory() + "/state/preferences";
  EXPECT_EQ(run({"--preferences-dir", elsewhere, "defaults", "write", "A", "b"}).status, 0);
  EXPECT_EQ(SXValue::parse(slurp(elsewhere + "/com.vendra.sonex.json")), (SXValue{{"A", "b"}}));
  EXPECT_EQ(slurp(file), "[not an object");
}

TEST_F(SxreportctlTest, EventsReadsTheAnalyticsStore) {
  EXPECT_EQ(run({"events"}).status, 7);  // no store yet
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open((server_.directory() + "/tallyvane.db").c_str(), &db), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(db,
                         "CREATE TABLE events(id INTEGER PRIMARY KEY, time REAL, name TEXT, "
                         "payload_json TEXT);"
                         "INSERT INTO events VALUES (1, 10.5, 'a', '{\"n\":1}');"
                         "INSERT INTO events VALUES (2, 11.0, 'b', '{}');"
                         "INSERT INTO events VALUES (3, 12.25, 'a', '{\"n\":3}');",
                         nullptr, nullptr, nullptr),
            SQLITE_OK);
  sqlite3_close(db);

  EXPECT_EQ(run({"events"}).out,
            "1  10.500  a  {\"n\":1}\n2  11.000  b  {}\n3  12.250  a  {\"n\":3}\n");
  EXPECT_EQ(run({"events", "--name", "a", "--limit", "1"}).out, "3  12.250  a  {\"n\":3}\n");
  EXPECT_EQ(run({"events", "--since", "1970-01-01T00:00:11Z", "--name", "a"}).out,
            "3  12.250  a  {\"n\":3}\n");
  EXPECT_EQ(run({"events", "--since", "1h"}).out, "(none)\n");
  SXValue json = SXValue::parse(run({"--json", "events", "--name", "b"}).out);
  EXPECT_EQ(
      json,
      SXValue::array({{{"id", 2}, {"time", 11.0}, {"name", "b"}, {"payload", SXValue::object()}}}));
}

}  // namespace
