// The daemon's stores across crashes: kill -9 under load loses no committed row, and a store
// file that is no database is moved aside and replaced rather than stopping the daemon.
#include <gtest/gtest.h>
#include <signal.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "support/Daemon.h"

namespace {

using namespace std::chrono_literals;

struct Counts {
  int64_t events = 0, entries = 0, messages = 0;
};

int64_t countRows(const TestDaemon& daemon, const std::string& db, const std::string& table) {
  auto rows = daemon.rows(db, "SELECT count(*) AS n FROM " + table);
  return rows.empty() ? 0 : rows[0]["n"].get<int64_t>();
}

Counts committed(const TestDaemon& daemon) {
  return {countRows(daemon, "tallyvane.db", "events"),
          countRows(daemon, "joulebook.db", "entries"),
          countRows(daemon, "fernreporting.db", "messages")};
}

// Sends messages that reach all three stores until stopped (or until the daemon is gone).
class Load {
 public:
  explicit Load(const TestDaemon& daemon) : client_(daemon.client()) {
    replied(client_->createReportingSession(7));
    thread_ = std::thread([this] {
      for (int i = 0; !stop_; ++i) {
        auto result = client_->sendMessage({{"EngineOnTime", 1.5}, {"n", i}}, 3, 1,
                                           std::vector<int64_t>{7}, std::chrono::seconds(5))
                          .get();
        if (result.status != SXCallStatus::kReplied) break;
      }
    });
  }
  ~Load() {
    stop_ = true;
    thread_.join();
  }

 private:
  std::unique_ptr<SXReportingClient> client_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

std::vector<std::string> filesStartingWith(const std::string& dir, const std::string& prefix) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    std::string name = entry.path().filename().string();
    if (name.rfind(prefix, 0) == 0) names.push_back(name);
  }
  return names;
}

}  // namespace

TEST(CrashSafetyEndToEnd, StoresUseWriteAheadLogging) {
  TestDaemon daemon;
  for (const char* db : {"tallyvane.db", "joulebook.db", "fernreporting.db"}) {
    auto mode = daemon.rows(db, "PRAGMA journal_mode");
    ASSERT_EQ(mode.size(), 1u) << db;
    EXPECT_EQ(mode[0]["journal_mode"], "wal") << db;
  }
}

TEST(CrashSafetyEndToEnd, KillNineUnderLoadLosesNoCommittedRow) {
  SXTestTempDir state;
  TestDaemon::Options options;
  options.extraArgs = {"--state-dir", state.file("")};
  Counts seen;
  {
    TestDaemon daemon(options);
    Load load(daemon);
    // A separate reader sees only committed rows; whatever it saw must survive the kill.
    ASSERT_TRUE(waitUntil(
        [&] {
          seen = committed(daemon);
          return seen.events >= 300 && seen.entries >= 300 && seen.messages >= 300;
        },
        60s));
    seen = committed(daemon);
    ASSERT_EQ(::kill(daemon.pid(), SIGKILL), 0);
    EXPECT_EQ(daemon.waitForExit(), 128 + SIGKILL);
  }

  TestDaemon restarted(options);
  Counts after = committed(restarted);
  EXPECT_GE(after.events, seen.events);
  EXPECT_GE(after.entries, seen.entries);
  EXPECT_GE(after.messages, seen.messages);
  EXPECT_EQ(restarted.countInLog("moved it to"), 0u) << restarted.log();

  auto client = restarted.client();
  ASSERT_TRUE(replied(client->createReportingSession(8)));
  EXPECT_FALSE(replied(client->sendMessage({{"EngineOnTime", 2.0}}, 3, 1, std::vector<int64_t>{8})));
  EXPECT_TRUE(waitUntil([&] {
    Counts now = committed(restarted);
    return now.events > after.events && now.entries > after.entries &&
           now.messages > after.messages;
  }));
}

TEST(CrashSafetyEndToEnd, DamagedStoresAreMovedAsideAndRecreated) {
  SXTestTempDir state;
  const std::string garbage(8192, '\x5a');
  std::ofstream(state.file("tallyvane.db"), std::ios::binary) << garbage;
  std::ofstream(state.file("fernreporting.db"), std::ios::binary) << "not a database at all";
  // A directory where the file should be: SQLite cannot open it, whoever we run as.
  std::filesystem::create_directories(state.file("joulebook.db/x"));

  TestDaemon::Options options;
  options.extraArgs = {"--state-dir", state.file("")};
  auto first = std::make_unique<TestDaemon>(options);
  TestDaemon& daemon = *first;
  EXPECT_TRUE(daemon.waitForLog("moved it to", 3)) << daemon.log();
  EXPECT_GE(daemon.countInLog("<3>"), 3u);  // error level
  for (const char* db : {"tallyvane.db", "joulebook.db", "fernreporting.db"}) {
    auto aside = filesStartingWith(state.file(""), std::string(db) + ".damaged-");
    ASSERT_EQ(aside.size(), 1u) << db;
  }
  std::ifstream kept(state.file(filesStartingWith(state.file(""), "tallyvane.db.damaged-")[0]),
                     std::ios::binary);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(kept), {}), garbage);

  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(9)));
  EXPECT_FALSE(replied(client->sendMessage({{"EngineOnTime", 1.0}}, 3, 1, std::vector<int64_t>{9})));
  EXPECT_TRUE(waitUntil([&] {
    Counts now = committed(daemon);
    return now.events > 0 && now.entries > 0 && now.messages > 0;
  }));

  // The new stores are healthy: a second start moves nothing.
  first.reset();
  TestDaemon again(options);
  EXPECT_EQ(again.countInLog("moved it to"), 0u) << again.log();
}
