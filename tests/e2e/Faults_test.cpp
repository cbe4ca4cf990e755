// A full or a slow disk under the real daemon's stores.
#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <thread>

#include "support/Daemon.h"

namespace {

using namespace std::chrono_literals;

// A daemon whose stores' directory is under the fault library (tests/faults): their writes fail
// with ENOSPC, or take `delayMs` when it is set, while `trigger` exists.
TestDaemon::Options faultyDisk(const SXTestTempDir& faults, const std::string& trigger,
                               const char* delayMs = nullptr) {
  TestDaemon::Options options;
  options.stateDir = faults.file("lib");
  std::filesystem::create_directories(options.stateDir);
  // The shim comes before the sanitizer runtime in the load order, which ASan refuses unless
  // told not to check; a daemon built without ASan ignores this.
  const char* own = ::getenv("ASAN_OPTIONS");
  options.environment = {{"LD_PRELOAD", SXR_FAULTS_LIB},
                         {"SXR_FAULT_DIR", options.stateDir},
                         {"SXR_FAULT_TRIGGER", trigger},
                         {"ASAN_OPTIONS", std::string(own ? own : "") + (own && *own ? ":" : "") +
                                              "verify_asan_link_order=0"}};
  if (delayMs) options.environment["SXR_FAULT_DELAY_MS"] = delayMs;
  return options;
}

// Rows in each store's table that a message reaches: events, power-log entries, spooled messages.
using RowCounts = std::array<SXValue, 3>;
RowCounts rowCounts(const TestDaemon& daemon) {
  auto count = [&](const char* db, const char* table) {
    auto rows = daemon.rows(db, std::string("SELECT count(*) AS n FROM ") + table);
    return rows.empty() ? SXValue(0) : rows[0]["n"];
  };
  return {count("tallyvane.db", "events"), count("joulebook.db", "entries"),
          count("fernreporting.db", "messages")};
}
bool allGrew(const RowCounts& now, const RowCounts& before) {
  return now[0] > before[0] && now[1] > before[1] && now[2] > before[2];
}

// A message that reaches all three stores.
SXValue payload(int n) { return {{"EngineOnTime", 1.5}, {"n", n}}; }

SXValue writeErrors(SXReportingClient& client) {
  return replied(client.status())["counters"]["store_write_errors"];
}

// How often connections were paused by back-pressure.
SXValue backpressurePauses(SXReportingClient& client) {
  return replied(client.status())["counters"]["guardrail_dropped"]["requests_backpressure"];
}

}  // namespace

TEST(FaultsEndToEnd, FullDiskIsLoggedAndSurvivedAndStoresWriteAgain) {
  SXTestTempDir faults;
  std::string trigger = faults.file("disk-full");
  TestDaemon::Options options = faultyDisk(faults, trigger);
  options.device = {{"InternalBuild", true}};
  TestDaemon daemon(options);
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(1)));
  EXPECT_FALSE(replied(client->sendMessage(payload(0), 3, 1, std::vector<int64_t>{1})));
  ASSERT_TRUE(waitUntil([&] { return allGrew(rowCounts(daemon), {0, 0, 0}); })) << daemon.log();
  EXPECT_EQ(writeErrors(*client),
            (SXValue{{"tallyvane", 0}, {"joulebook", 0}, {"fernreporting", 0}}));

  std::ofstream(trigger) << "full";
  RowCounts before = rowCounts(daemon);
  SXValue countersBefore = replied(client->status())["counters"];
  for (int i = 1; i <= 20; ++i) {
    EXPECT_FALSE(replied(client->sendMessage(payload(i), 3, 1, std::vector<int64_t>{1})));
  }
  // Every store counts what it could not write, and says so at error level.
  EXPECT_TRUE(waitUntil([&] {
    SXValue errors = writeErrors(*client);
    return errors["tallyvane"] > 0 && errors["joulebook"] > 0 && errors["fernreporting"] >= 20;
  })) << writeErrors(*client)
      << "\n"
      << daemon.log();
  // A send the spool refused is not delivered; the batch-written stores had taken theirs.
  SXValue counters = replied(client->status())["counters"];
  auto rose = [&](const std::string& path) {
    SXValue::json_pointer at(path);
    return counters[at].get<int64_t>() - countersBefore[at].get<int64_t>();
  };
  EXPECT_EQ(rose("/messages_received"), 20);
  EXPECT_EQ(rose("/messages_delivered/fernreporting"), 0);
  EXPECT_EQ(rose("/messages_delivered/tallyvane"), 20);
  EXPECT_EQ(rose("/messages_delivered/joulebook"), 20);
  EXPECT_TRUE(daemon.waitForLog("dropped ")) << daemon.log();
  EXPECT_TRUE(daemon.waitForLog("cannot store the message")) << daemon.log();
  // The daemon keeps answering, and the summary file, on another disk, is still written.
  ASSERT_TRUE(replied(client->createReportingSession(2)));
  auto start = client->startReportingSessionForID(2, kSXWaitForever);
  EXPECT_FALSE(replied(client->sendMessage({{"k", 1}}, 3, 1, std::vector<int64_t>{2})));
  EXPECT_TRUE(replied(client->stopReportingSessionForID(2)));
  EXPECT_TRUE(start.get().value);
  EXPECT_TRUE(waitUntil([&] { return !std::filesystem::is_empty(daemon.dir("diag")); }));
  EXPECT_EQ(rowCounts(daemon), before);

  std::filesystem::remove(trigger);
  EXPECT_FALSE(replied(client->sendMessage(payload(99), 3, 1, std::vector<int64_t>{1})));
  EXPECT_TRUE(waitUntil([&] { return allGrew(rowCounts(daemon), before); })) << daemon.log();
  EXPECT_EQ(daemon.countInLog("moved it to"), 0u);  // a full disk is no damaged store
  for (const char* db : {"tallyvane.db", "joulebook.db", "fernreporting.db"}) {
    EXPECT_EQ(daemon.rows(db, "PRAGMA integrity_check")[0]["integrity_check"], "ok") << db;
  }
}

TEST(FaultsEndToEnd, ASlowStoreHoldsBackOnlyTheClientThatFloodsIt) {
  SXTestTempDir faults;
  std::string trigger = faults.file("disk-slow");
  TestDaemon::Options options = faultyDisk(faults, trigger, "50");
  // A pool smaller than one connection's budget: the other client is read only through the
  // room every connection keeps while the pool is over its limit.
  options.extraArgs = {"--max-connection-bytes", "262144", "--max-inflight-bytes", "131072"};
  TestDaemon daemon(options);
  auto quiet = daemon.client();
  ASSERT_TRUE(replied(quiet->createReportingSession(1)));
  auto flooder = daemon.client();
  ASSERT_TRUE(replied(flooder->createReportingSession(2)));
  flooder->startReportingSessionForID(
      2, [](SXCallResult<bool>) {}, kSXWaitForever);
  ASSERT_EQ(replied(flooder->reporterID(2)).reporterID, 2);
  SXValue pausesBefore = backpressurePauses(*quiet);

  std::ofstream(trigger) << "slow";
  std::vector<TestFlood::Sender> senders;
  senders.push_back({std::move(flooder), std::vector<int64_t>{2}});
  TestFlood flood(std::move(senders), 64);
  // Every write to the stores takes 50 ms: the flood's budget fills and its connection waits.
  ASSERT_TRUE(waitUntil([&] { return backpressurePauses(*quiet) > pausesBefore; }, 30s))
      << flood.acknowledgedCount() << " answered\n"
      << daemon.log();

  // Meanwhile the other client is answered as usual, however far the stores are behind.
  auto slowest = std::chrono::steady_clock::duration::zero();
  for (int64_t i = 0; i < 20; ++i) {
    auto asked = std::chrono::steady_clock::now();
    EXPECT_EQ(replied(quiet->reporterID(1)).reporterID, 1);
    EXPECT_TRUE(replied(quiet->createReportingSession(100 + i)));
    slowest = std::max(slowest, std::chrono::steady_clock::now() - asked);
    std::this_thread::sleep_for(100ms);
  }
  EXPECT_LT(slowest, 2s);

  std::filesystem::remove(trigger);
  flood.stop();
  // Every message answered lands in the stores once the disk keeps up again.
  auto acknowledged = flood.acknowledged();
  ASSERT_GT(acknowledged.size(), 0u);
  size_t missing = acknowledged.size();
  EXPECT_TRUE(waitUntil(
      [&] {
        auto events = TestFlood::stored(daemon, "tallyvane.db", "events");
        auto messages = TestFlood::stored(daemon, "fernreporting.db", "messages");
        missing = 0;
        for (int64_t xid : acknowledged) {
          if (!events.count(xid) || !messages.count(xid)) ++missing;
        }
        return missing == 0;
      },
      60s))
      << missing << " of " << acknowledged.size() << " answered messages not stored\n"
      << daemon.log();
  EXPECT_EQ(daemon.countInLog("dropped "), 0u) << daemon.log();
}
