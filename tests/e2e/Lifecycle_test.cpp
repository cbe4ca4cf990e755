// Session start and stop through the real daemon: the held start reply, the driver delta, the
// summary and the flush; and the daemon's own life: what it tells the service manager, reloads
// and the bound on a stop.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <asio.hpp>
#include <filesystem>
#include <fstream>
#include <regex>

#include "support/Daemon.h"

namespace {

using namespace std::chrono_literals;

// A datagram socket standing in for the service manager's notify socket.
class NotifySocket {
 public:
  explicit NotifySocket(const std::string& path) : fd_(::socket(AF_UNIX, SOCK_DGRAM, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    EXPECT_EQ(::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    timeval poll{0, 50'000};
    ::setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &poll, sizeof poll);
  }
  ~NotifySocket() { ::close(fd_); }

  // The next notification holding `fragment`, skipping those before it; empty after 15 s.
  std::string next(const std::string& fragment) {
    auto deadline = std::chrono::steady_clock::now() + 15s;
    while (std::chrono::steady_clock::now() < deadline) {
      char buffer[4096];
      ssize_t n = ::recv(fd_, buffer, sizeof buffer, 0);
      if (n <= 0) continue;
      std::string message(buffer, static_cast<size_t>(n));
      if (message.find(fragment) != std::string::npos) return message;
    }
    return "";
  }

 private:
  const int fd_;
};

}  // namespace

// The limits file applies on SIGHUP, under the flags, and a bad one changes nothing.
TEST(LifecycleEndToEnd, TellsTheServiceManagerItsStateAndReloadsTheLimitsFileOnSighup) {
  SXTestTempDir dir;
  NotifySocket manager(dir.file("notify"));
  TestDaemon daemon(
      {.extraArgs = {"--max-reporter-ids", "1"},
       .environment = {{"NOTIFY_SOCKET", dir.file("notify")}, {"WATCHDOG_USEC", "200000"}},
       .daemonConfig = {{"limits", {{"max-payload-bytes", 64}, {"max-reporter-ids", 8}}}}});
  EXPECT_NE(manager.next("READY=1").find("STATUS=serving on "), std::string::npos);
  EXPECT_NE(manager.next("WATCHDOG=1"), "");
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(7)));
  const SXValue big = {{"text", std::string(200, 'x')}};
  auto send = [&](const SXValue& payload, std::vector<int64_t> ids) {
    return client->sendMessage(payload, 3, 1, ids).get().status;
  };
  EXPECT_EQ(send(big, {7}), SXCallStatus::kRemoteError);

  // A key gone is its default again; a limit of the listener waits for the next start.
  daemon.writeConfig("sxreportingd.json",
                     {{"limits", {{"max-reporter-ids", 8}, {"max-inflight-bytes", 8192}}}});
  ASSERT_EQ(::kill(daemon.pid(), SIGHUP), 0);
  EXPECT_NE(manager.next("RELOADING=1").find("MONOTONIC_USEC="), std::string::npos);
  EXPECT_NE(manager.next("READY=1"), "");  // the reload is over
  ASSERT_TRUE(daemon.waitForLog("limit max-payload-bytes: 65536 (was 64)")) << daemon.log();
  EXPECT_EQ(daemon.countInLog("limit max-inflight-bytes changed to 8192; it applies at the next "
                              "start"),
            1u);
  EXPECT_EQ(send(big, {7}), SXCallStatus::kReplied);
  EXPECT_EQ(send({{"a", 1}}, {7, 8}), SXCallStatus::kRemoteError);  // the flag wins

  // A section that is bad anywhere changes nothing, not even its good keys.
  daemon.writeConfig("sxreportingd.json",
                     {{"limits", {{"max-payload-bytes", 64}, {"max-reporter-ids", -5}}}});
  ASSERT_EQ(::kill(daemon.pid(), SIGHUP), 0);
  ASSERT_TRUE(daemon.waitForLog("max-reporter-ids is -5, not a positive integer; the limits stay"));
  EXPECT_EQ(send(big, {7}), SXCallStatus::kReplied);

  ASSERT_EQ(::kill(daemon.pid(), SIGTERM), 0);
  EXPECT_NE(manager.next("STOPPING=1"), "");
  EXPECT_EQ(daemon.waitForExit(), 0);
  EXPECT_EQ(daemon.countInLog("stopped after a drain of"), 1u) << daemon.log();
}

// A collector that never answers holds the exporter's batch, and with it the drain.
TEST(LifecycleEndToEnd, AStopThatCannotDrainEndsAtItsLimitOrAtASecondSignal) {
  asio::io_context io;
  asio::ip::tcp::acceptor silent(io, {asio::ip::address_v4::loopback(), 0});
  silent.non_blocking(true);
  std::string endpoint =
      "http://127.0.0.1:" + std::to_string(silent.local_endpoint().port()) + "/v1/logs";
  for (bool secondSignal : {false, true}) {
    TestDaemon daemon(
        {.extraArgs = {"--drain-timeout-ms", secondSignal ? "60000" : "300"},
         .fernConfig = {
             {"backends", {"spool", "otlp-http"}},
             {"otlp-http", {{"endpoint", endpoint}, {"intervalMs", 20}, {"timeoutMs", 60000}}}}});
    auto client = daemon.client();
    ASSERT_TRUE(replied(client->createReportingSession(7)));
    EXPECT_FALSE(replied(client->sendMessage({{"n", 1}}, 3, 1, std::vector<int64_t>{7})));
    asio::ip::tcp::socket post(io);  // the exporter's, never answered
    ASSERT_TRUE(waitUntil([&] {
      std::error_code ec;
      silent.accept(post, ec);
      return !ec;
    }));
    ASSERT_EQ(::kill(daemon.pid(), SIGTERM), 0);
    ASSERT_TRUE(daemon.waitForLog("stopping on SIGTERM"));
    if (secondSignal) {
      ASSERT_EQ(::kill(daemon.pid(), SIGTERM), 0);
    }
    EXPECT_EQ(daemon.waitForExit(), 1);
    EXPECT_EQ(daemon.countInLog(secondSignal ? "a second SIGTERM came during the stop drain"
                                             : "the stop drain took longer than its limit"),
              1u)
        << daemon.log();
    EXPECT_EQ(daemon.countInLog("1 messages not exported"), 1u) << daemon.log();
  }
}

TEST(LifecycleEndToEnd, StartReplyWaitsForStopThenSpoolAndFileHoldTheSession) {
  TestDaemon daemon(
      {.device = {{"InternalBuild", true}, {"DeviceClassNumber", 1}},
       .counters = {
           {"Speaker/-/underruns", 5}, {"Speaker/-/resets", 9}, {"Haptics/Stats/kicks", 1}}});
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(42)));
  ASSERT_TRUE(replied(client->setServiceType(7, 42)));
  ASSERT_TRUE(
      replied(client->setConfiguration(SXValue{{"HostApplicationDisplayID", "player"}}, 42)));
  auto start = client->startReportingSessionForID(42, kSXWaitForever);
  EXPECT_FALSE(replied(client->sendMessage({{"k", 1}}, 3, 1, std::vector<int64_t>{42})));
  EXPECT_EQ(start.wait_for(300ms), std::future_status::timeout);  // held until stop

  daemon.setCounter("Speaker/-/underruns", 8);  // rose by 3
  daemon.setCounter("Speaker/-/resets", 2);     // went down: not reported
  auto other = daemon.client();                 // stop from another client reaches it too
  EXPECT_TRUE(replied(other->stopReportingSessionForID(42)));
  EXPECT_TRUE(replied(std::move(start)));

  auto flushes = daemon.waitForRows("fernreporting.db", "SELECT time FROM flushes", 1);
  ASSERT_EQ(flushes.size(), 1u);
  auto messages = daemon.rows("fernreporting.db",
                              "SELECT category, type, payload_json, time FROM messages "
                              "WHERE session_id IS NOT NULL ORDER BY id");
  ASSERT_EQ(messages.size(), 3u);
  EXPECT_EQ(messages[0]["category"], 3);
  EXPECT_EQ(messages[1]["category"], 9);  // the driver delta, before the summary
  EXPECT_EQ(SXValue::parse(messages[1]["payload_json"].get<std::string>()),
            (SXValue{{"Speaker_underruns", 3}}));
  EXPECT_EQ(messages[2]["category"], 65535);
  EXPECT_EQ(messages[2]["type"], 65535);
  SXValue summary = SXValue::parse(messages[2]["payload_json"].get<std::string>());
  EXPECT_EQ(summary["SX_Session_Summary_Event"], "7");
  EXPECT_EQ(summary["Playback_Start_1"], R"({"k":1})");
  EXPECT_EQ(summary["KestrelStats_Generic_1"], R"({"Speaker_underruns":3})");
  EXPECT_LE(messages[2]["time"].get<double>(), flushes[0]["time"].get<double>());
  // (The summary file: PermissionsEndToEnd.SummaryFilesStayInTheirOwnClosedDirectory.)
}

TEST(LifecycleEndToEnd, NoBackendsWaitsNineSecondsWithoutDelayingOtherSessions) {
  TestDaemon daemon({.fernConfig = {{"backends", SXValue::array()}}});
  auto client = daemon.client();
  for (int64_t id : {1, 2}) ASSERT_TRUE(replied(client->createReportingSession(id)));
  auto startOne = client->startReportingSessionForID(1, kSXWaitForever);
  EXPECT_TRUE(daemon.waitForLog("waiting for fernreportingd to find backends"));
  // Session 2 is not started: its send goes standalone at once, though session 1 waits.
  auto before = std::chrono::steady_clock::now();
  EXPECT_FALSE(replied(client->sendMessage({{"k", 2}}, 3, 1, std::vector<int64_t>{2})));
  auto singles = daemon.waitForRows("fernreporting.db",
                                    "SELECT id FROM messages WHERE session_id IS NULL", 1, 5s);
  EXPECT_EQ(singles.size(), 1u);
  EXPECT_LT(std::chrono::steady_clock::now() - before, 5s);
  EXPECT_FALSE(replied(client->sendMessage({{"k", 1}}, 3, 1, std::vector<int64_t>{1})));

  EXPECT_TRUE(replied(client->stopReportingSessionForID(1)));
  EXPECT_TRUE(startOne.get().value);
  EXPECT_TRUE(daemon.waitForLog("failed to find backend", 1, 20s));
  EXPECT_TRUE(daemon.rows("fernreporting.db", "SELECT id FROM flushes").empty());
}

// The packaged units as systemd reads them, with ExecStart pointing at the build's daemon:
// systemd-analyze verify finds nothing to say, and the daemon accepts the unit's command line.
TEST(LifecycleEndToEnd, SystemdVerifiesTheUnitsAndTheDaemonAcceptsTheirCommandLine) {
  SXTestTempDir dir;
  const std::filesystem::path units = std::filesystem::path(SXR_SOURCE_DIR) / "packaging/systemd";
  const std::string service = std::regex_replace(
      SXTestReadFile(units / "sxreportingd.service.in"), std::regex("@SXR_SBINDIR@"),
      std::filesystem::path(SXR_DAEMON_PATH).parent_path().string());
  ASSERT_FALSE(std::regex_search(service, std::regex("@[A-Z_]+@"))) << "a variable is left";
  std::ofstream(dir.file("sxreportingd.service")) << service;
  std::filesystem::copy_file(units / "sxreportingd.socket", dir.file("sxreportingd.socket"));

  // ExecStart with its continuation lines joined; --version last makes the daemon read every
  // flag before it and stop there, touching no directory.
  const std::string joined = std::regex_replace(service, std::regex("\\\\\n"), " ");
  std::smatch line;
  ASSERT_TRUE(std::regex_search(joined, line, std::regex("\nExecStart=([^\n]*)")));
  CommandRun daemon = runCommand(line[1].str() + " --version 2>&1");
  EXPECT_EQ(daemon.status, 0) << daemon.output;
  EXPECT_TRUE(std::regex_match(daemon.output, std::regex("sxreportingd [0-9.]+\n")))
      << daemon.output;

  if (runCommand("command -v systemd-analyze").status != 0) GTEST_SKIP() << "no systemd-analyze";
  CommandRun verify = runCommand("cd " + shellQuoted(dir.path()) +
                                 " && systemd-analyze verify --man=no ./sxreportingd.socket "
                                 "./sxreportingd.service 2>&1");
  EXPECT_EQ(verify.status, 0) << verify.output;
  EXPECT_EQ(verify.output, "");
}
