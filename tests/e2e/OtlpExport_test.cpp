// The "otlp-http" backend of the real daemon: spooled messages reach a collector on loopback
// as OTLP log records (gzip JSON by default, protobuf when asked), survive a failing collector
// and a restart, and go exactly once.
#include <gtest/gtest.h>
#include <signal.h>

#include <map>

#include "support/Daemon.h"
#include "support/OtlpReceiver.h"

namespace {

using namespace std::chrono_literals;

TestDaemon::Options Exporting(const OtlpReceiver& receiver, const char* encoding = "json") {
  TestDaemon::Options options;
  options.fernConfig = {{"backends", {"spool", "otlp-http"}},
                        {"otlp-http",
                         {{"endpoint", receiver.endpoint()},
                          {"encoding", encoding},
                          {"intervalMs", 50},
                          {"initialBackoffMs", 20},
                          {"maxBackoffMs", 100},
                          {"headers", {{"X-Test", "yes"}}}}}};
  return options;
}

// The accepted records by sxr.message.id, with how often each came.
std::map<int64_t, int> Deliveries(const OtlpReceiver& receiver) {
  std::map<int64_t, int> deliveries;
  for (const SXValue& record : receiver.acceptedRecords()) {
    ++deliveries[std::stoll(record["attrs"].value("sxr.message.id", "-1"))];
  }
  return deliveries;
}

std::vector<int64_t> SpooledIds(const TestDaemon& daemon) {
  std::vector<int64_t> ids;
  for (const SXValue& row : daemon.rows("fernreporting.db", "SELECT id FROM messages")) {
    ids.push_back(row["id"].get<int64_t>());
  }
  return ids;
}

// Sends `count` messages to session 7, created and never started: they go standalone.
void SendStandalone(SXReportingClient& client, int first, int count) {
  for (int i = first; i < first + count; ++i) {
    EXPECT_FALSE(replied(client.sendMessage({{"n", i}}, 3, 1, std::vector<int64_t>{7})));
  }
}

bool AllDeliveredOnce(const OtlpReceiver& receiver, const std::vector<int64_t>& ids) {
  auto deliveries = Deliveries(receiver);
  return std::all_of(ids.begin(), ids.end(), [&](int64_t id) { return deliveries[id] == 1; });
}

}  // namespace

TEST(OtlpExportEndToEnd, SessionAndStandaloneMessagesArriveAsLogRecords) {
  OtlpReceiver receiver;
  TestDaemon::Options options = Exporting(receiver);
  options.environment = {{"OTEL_EXPORTER_OTLP_HEADERS", "X-Test=env,X-Env=from%20env"},
                         {"OTEL_RESOURCE_ATTRIBUTES", "deployment.environment=e2e"}};
  TestDaemon daemon(options);
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(42)));
  ASSERT_TRUE(replied(client->setServiceType(2, 42)));
  ASSERT_TRUE(replied(client->createReportingSession(7)));
  auto start = client->startReportingSessionForID(42, kSXWaitForever);
  EXPECT_FALSE(replied(client->sendMessage({{"peak level", 3}}, 3, 1, std::vector<int64_t>{42})));
  SendStandalone(*client, 1, 1);
  EXPECT_TRUE(replied(client->stopReportingSessionForID(42)));
  EXPECT_TRUE(start.get().value);

  // The session's message, its summary and the standalone message.
  daemon.waitForRows("fernreporting.db", "SELECT id FROM messages", 3);
  ASSERT_TRUE(waitUntil([&] { return AllDeliveredOnce(receiver, SpooledIds(daemon)); }))
      << daemon.log();
  auto request = receiver.requests().front();
  EXPECT_EQ(request.headers["content-type"], "application/json");
  EXPECT_EQ(request.headers["content-encoding"], "gzip");  // decoded by the receiver
  EXPECT_EQ(request.headers["x-test"], "yes");             // the file wins
  EXPECT_EQ(request.headers["x-env"], "from env");         // the environment fills in
  std::map<std::string, std::string> resource;
  SXValue body = OtlpReceiver::json(request);
  for (const SXValue& attribute : body["resourceLogs"][0]["resource"]["attributes"]) {
    resource[attribute["key"]] = attribute["value"]["stringValue"];
  }
  EXPECT_EQ(resource["service.name"], "sxreportingd");
  EXPECT_EQ(resource["deployment.environment"], "e2e");
  EXPECT_FALSE(resource["service.version"].empty());
  EXPECT_FALSE(resource["host.name"].empty());

  std::map<std::string, SXValue> byKind;  // "<kind> <category>" -> record
  for (const SXValue& record : receiver.acceptedRecords()) {
    const SXValue& attrs = record["attrs"];
    byKind[attrs.value("sxr.message.kind", "") + " " + attrs.value("sxr.category", "")] = record;
  }
  ASSERT_TRUE(byKind.count("session 3")) << receiver.acceptedRecords().size();
  const SXValue& inSession = byKind["session 3"];
  const SXValue& attrs = inSession["attrs"];
  EXPECT_EQ(attrs["sxr.reporter_id"], "42");
  EXPECT_EQ(attrs["sxr.service_name"], "telephony_session");
  EXPECT_EQ(attrs["sxr.type"], "1");
  EXPECT_NE(attrs.value("sxr.session.token", ""), "");
  EXPECT_EQ(inSession["severityText"], "INFO");
  // The record's time is the message's, stored by the spool; the observed time is the export's.
  auto nanos = [](const SXValue& text) { return std::stod(text.get<std::string>()); };
  auto stored = daemon.rows("fernreporting.db",
                            "SELECT time FROM messages WHERE category = 3 "
                            "AND session_id IS NOT NULL");
  ASSERT_EQ(stored.size(), 1u);
  EXPECT_NEAR(nanos(inSession["timeUnixNano"]) / 1e9, stored[0]["time"].get<double>(), 1e-3);
  EXPECT_GE(nanos(inSession["observedTimeUnixNano"]), nanos(inSession["timeUnixNano"]));
  EXPECT_EQ(inSession["body"]["kvlistValue"]["values"][0],
            (SXValue{{"key", "peak_level"}, {"value", {{"intValue", "3"}}}}));
  EXPECT_TRUE(byKind.count("session 65535"));  // the summary
  ASSERT_TRUE(byKind.count("standalone 3"));
  EXPECT_EQ(byKind["standalone 3"]["attrs"]["sxr.service_name"], "unknown");
  EXPECT_EQ(byKind["standalone 3"]["attrs"].value("sxr.session.token", ""), "");
  EXPECT_TRUE(daemon.waitForLog("exporting spooled messages to " + receiver.endpoint()));
}

TEST(OtlpExportEndToEnd, FailingCollectorAndRestartLoseNothingAndRepeatNothing) {
  OtlpReceiver receiver;
  TestDaemon first(Exporting(receiver, "protobuf"));
  auto client = first.client();
  ASSERT_TRUE(replied(client->createReportingSession(7)));
  SendStandalone(*client, 1, 3);
  ASSERT_TRUE(waitUntil([&] { return Deliveries(receiver).size() == 3; }));

  // The collector fails: the new messages wait in the spool, retried with one error line.
  receiver.failNext(1000000, 503);
  size_t before = receiver.requests().size();
  SendStandalone(*client, 4, 3);
  ASSERT_TRUE(waitUntil([&] { return receiver.requests().size() >= before + 3; }));
  EXPECT_EQ(first.countInLog("cannot export to " + receiver.endpoint()), 1u) << first.log();
  EXPECT_EQ(Deliveries(receiver).size(), 3u);

  // A crash, then a restart on the same spool while the collector drops connections.
  ::kill(first.pid(), SIGKILL);
  first.waitForExit();
  receiver.dropNext(2);
  TestDaemon::Options options = Exporting(receiver, "protobuf");
  options.extraArgs = {"--state-dir", first.dir("lib")};
  TestDaemon second(options);
  auto again = second.client();
  ASSERT_TRUE(replied(again->createReportingSession(7)));
  SendStandalone(*again, 7, 2);

  auto ids = SpooledIds(first);
  ASSERT_TRUE(waitUntil([&] {
    ids = SpooledIds(first);
    return ids.size() == 8 && AllDeliveredOnce(receiver, ids);
  })) << second.log();
  EXPECT_EQ(Deliveries(receiver).size(), 8u);  // nothing else, nothing twice
  size_t dropped = 0;
  for (const auto& request : receiver.requests()) dropped += request.status == 0;
  EXPECT_EQ(dropped, 2u);
  EXPECT_TRUE(second.waitForLog("again after"));
  EXPECT_EQ(receiver.requests().back().headers["content-type"], "application/x-protobuf");
}

TEST(OtlpExportEndToEnd, SighupStartsAndStopsTheExportAndExportedMessagesLeaveTheSpool) {
  OtlpReceiver receiver;
  TestDaemon::Options options;
  options.daemonConfig = {{"retention", {{"intervalSeconds", 0.1}}}};
  TestDaemon daemon(options);
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(7)));
  SendStandalone(*client, 1, 5);
  ASSERT_EQ(daemon.waitForRows("fernreporting.db", "SELECT id FROM messages", 5).size(), 5u);
  EXPECT_FALSE(replied(client->status()).at("gauges").contains("spool_backlog"));

  daemon.writeConfig("fernreporting.json", Exporting(receiver).fernConfig);
  ASSERT_EQ(::kill(daemon.pid(), SIGHUP), 0);
  // What was spooled before the reload goes too.
  ASSERT_TRUE(waitUntil([&] {
    return AllDeliveredOnce(receiver, {1, 2, 3, 4, 5});
  })) << daemon.log();
  EXPECT_EQ(Deliveries(receiver).size(), 5u);
  EXPECT_TRUE(replied(client->status()).at("gauges").contains("spool_backlog"));
  // Once exported they go, but for the newest (message ids must never come back).
  EXPECT_TRUE(waitUntil([&] { return SpooledIds(daemon) == std::vector<int64_t>{5}; }))
      << daemon.log();

  daemon.writeConfig("fernreporting.json", {{"backends", {"spool"}}});
  ASSERT_EQ(::kill(daemon.pid(), SIGHUP), 0);
  ASSERT_TRUE(daemon.waitForLog("otlp-http export stopped")) << daemon.log();
  SendStandalone(*client, 6, 1);
  EXPECT_EQ(
      daemon.waitForRows("fernreporting.db", "SELECT id FROM messages WHERE id = 6", 1).size(), 1u);
  EXPECT_FALSE(replied(client->status()).at("gauges").contains("spool_backlog"));
  EXPECT_EQ(Deliveries(receiver).size(), 5u);
}
