// The daemon's stores across crashes: kill -9 under load loses no committed row and at most
// the documented number of answered but unstored messages, and a store file that is no
// database is moved aside and replaced rather than stopping the daemon.
#include <gtest/gtest.h>
#include <signal.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <map>

#include "support/Daemon.h"

namespace {

using namespace std::chrono_literals;

// Each store and the table a message reaches in it.
struct Store {
  const char* db;
  const char* table;
};
constexpr Store kStores[] = {
    {"tallyvane.db", "events"}, {"joulebook.db", "entries"}, {"fernreporting.db", "messages"}};

// id -> payload_json of every row committed in each store, as a reader of its own sees them.
using RowsById = std::array<std::map<int64_t, std::string>, 3>;
RowsById committedRows(const TestDaemon& daemon) {
  RowsById out;
  for (size_t i = 0; i < 3; ++i) {
    for (const auto& row : daemon.rows(
             kStores[i].db, std::string("SELECT id, payload_json FROM ") + kStores[i].table)) {
      out[i][row["id"].get<int64_t>()] = row["payload_json"].get<std::string>();
    }
  }
  return out;
}

std::vector<std::string> filesStartingWith(const std::string& dir, const std::string& prefix) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    std::string name = entry.path().filename().string();
    if (name.rfind(prefix, 0) == 0) names.push_back(name);
  }
  return names;
}

int64_t countRows(const TestDaemon& daemon, const Store& store) {
  auto rows = daemon.rows(store.db, std::string("SELECT count(*) AS n FROM ") + store.table);
  return rows.empty() ? 0 : rows[0]["n"].get<int64_t>();
}

// Sends one message to a started session of a new client and waits until each store holds
// more rows than `before`.
void expectNewRowsLand(const TestDaemon& daemon, const RowsById& before) {
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(900)));
  auto start = client->startReportingSessionForID(900, kSXWaitForever);
  EXPECT_FALSE(
      replied(client->sendMessage({{"EngineOnTime", 2.0}}, 3, 1, std::vector<int64_t>{900})));
  for (size_t i = 0; i < 3; ++i) {
    auto grew = [&] { return countRows(daemon, kStores[i]) > int64_t(before[i].size()); };
    EXPECT_TRUE(waitUntil(grew)) << kStores[i].db << "\n" << daemon.log();
  }
}

// The kinds of send a flood is made of. Each client has a session of its own.
struct FloodKind {
  const char* name;
  bool started;     // the sessions are started, else they are telephony sessions never started
  bool broadcast;   // no reporter-ID list, else each client sends to its own session
  bool perSession;  // a message makes one row per started session, else one
};
constexpr FloodKind kFloodKinds[] = {
    {"addressed", true, false, false},
    {"broadcast", true, true, true},
    {"standalone", false, false, false},
};

// Small budgets, so that the bound on what is answered but not stored is tight; the pool is
// smaller than the flood's connections' budgets together, so that it too holds them back.
constexpr int64_t kConnectionBytes = 256 * 1024;
constexpr int64_t kInflightBytes = 512 * 1024;
// As docs/protocol.md ("What a reply promises") counts: a message holds at least 512 bytes of
// its connection's budget until every store has it (256 + 4 x a send request, which takes 64
// bytes or more), and a connection holding less than 16 KiB is read whatever the pool holds.
constexpr int64_t kMinChargePerMessage = 512;
constexpr int64_t kPoolFloorBytes = 16 * 1024;
// Near a limit a connection still reads 4 KiB at a time, which may become 8 times as much.
constexpr int64_t kLastReadBytes = 8 * 4 * 1024;

void PrintTo(const FloodKind& kind, std::ostream* out) { *out << kind.name; }

TestDaemon::Options smallBudgets() {
  return {.extraArgs = {"--max-connection-bytes", std::to_string(kConnectionBytes),
                        "--max-inflight-bytes", std::to_string(kInflightBytes)}};
}

constexpr int kFloodClients = 4;
// What the budgets hold at most: answered messages that may not be stored yet.
constexpr size_t kBound =
    (kInflightBytes + (kPoolFloorBytes + kLastReadBytes) * kFloodClients) / kMinChargePerMessage;

// Clients of `kind` flooding `daemon`, each with at most `window` sends unanswered.
std::unique_ptr<TestFlood> startFlood(const TestDaemon& daemon, const FloodKind& kind,
                                      size_t window, SXValue payload = SXValue::object()) {
  std::vector<TestFlood::Sender> senders;
  for (int k = 0; k < kFloodClients; ++k) {
    auto client = daemon.client();
    int64_t reporter = 100 + k;
    EXPECT_TRUE(replied(client->createReportingSession(reporter)));
    if (kind.started) {
      client->startReportingSessionForID(
          reporter, [](SXCallResult<bool>) {}, kSXWaitForever);
    } else {
      EXPECT_TRUE(replied(client->setServiceType(2, reporter)));  // telephony: sent at once
    }
    // Handled after the start: every broadcast reaches every session.
    EXPECT_EQ(replied(client->reporterID(reporter)).reporterID, reporter);
    std::optional<std::vector<int64_t>> to;
    if (!kind.broadcast) to = std::vector<int64_t>{reporter};
    senders.push_back({std::move(client), std::move(to)});
  }
  return std::make_unique<TestFlood>(std::move(senders), window, std::move(payload));
}

}  // namespace

// SIGKILL loses at most what the budgets hold of the answered messages; SIGTERM stops reading,
// lets everything read be handled and stored, then exits 0.
class UnderFlood : public testing::TestWithParam<std::tuple<FloodKind, int>> {};

TEST_P(UnderFlood, LosesNoMoreAnsweredMessagesThanTheSignalAllows) {
  const auto& [kind, signal] = GetParam();
  TestDaemon daemon(smallBudgets());
  // A window wider than a connection's budget, so that the budget is what holds a client back;
  // several times what the budgets hold answered, so that they are full and the stores lag.
  auto flood = startFlood(daemon, kind, 2 * kConnectionBytes / kMinChargePerMessage);
  ASSERT_TRUE(waitUntil([&] { return flood->acknowledgedCount() >= 3 * kBound; }, 60s))
      << flood->acknowledgedCount() << " answered\n"
      << daemon.log();
  ASSERT_EQ(::kill(daemon.pid(), signal), 0);
  ASSERT_EQ(daemon.waitForExit(), signal == SIGKILL ? 128 + SIGKILL : 0) << daemon.log();
  flood->stop();

  const size_t rowsPerMessage = kind.perSession ? kFloodClients : 1;
  auto events = TestFlood::stored(daemon, "tallyvane.db", "events");
  auto messages = TestFlood::stored(daemon, "fernreporting.db", "messages");
  auto acknowledged = flood->acknowledged();
  size_t missing = 0;
  size_t missingOf[kFloodClients] = {};
  for (int64_t xid : acknowledged) {
    EXPECT_LE(events[xid], rowsPerMessage) << "stored twice: " << xid;
    if (events[xid] >= rowsPerMessage && messages[xid] >= rowsPerMessage) continue;
    ++missing;
    ++missingOf[TestFlood::senderOf(xid)];
  }
  if (signal == SIGTERM) {
    EXPECT_EQ(missing, 0u);
    return;
  }
  const size_t boundPerClient = (kConnectionBytes + kLastReadBytes) / kMinChargePerMessage;
  EXPECT_LE(missing, kBound);
  for (size_t of : missingOf) EXPECT_LE(of, boundPerClient);
}

INSTANTIATE_TEST_SUITE_P(CrashSafetyEndToEnd, UnderFlood,
                         testing::Combine(testing::ValuesIn(kFloodKinds),
                                          testing::Values(SIGKILL, SIGTERM)),
                         [](const auto& info) {
                           return std::string(std::get<0>(info.param).name) +
                                  (std::get<1>(info.param) == SIGKILL ? "_kill9" : "_term");
                         });

// Every row a reader saw committed before the kill is there after the restart, unchanged.
TEST(CrashSafetyEndToEnd, KillNineUnderLoadLosesNoCommittedRow) {
  SXTestTempDir state;
  TestDaemon::Options options{.stateDir = state.file("")};
  RowsById committed;
  {
    TestDaemon daemon(options);
    // One send at a time per client; EngineOnTime makes every message reach the power log too.
    auto flood = startFlood(daemon, kFloodKinds[0], 1, {{"EngineOnTime", 1.5}});
    ASSERT_TRUE(waitUntil([&] {
      committed = committedRows(daemon);
      return std::min({committed[0].size(), committed[1].size(), committed[2].size()}) >= 200;
    })) << daemon.log();
    committed = committedRows(daemon);  // the last look before the kill, the writers still busy
    ASSERT_EQ(::kill(daemon.pid(), SIGKILL), 0);
    EXPECT_EQ(daemon.waitForExit(), 128 + SIGKILL);
  }

  TestDaemon restarted(options);
  RowsById now = committedRows(restarted);
  for (size_t i = 0; i < 3; ++i) {
    const char* db = kStores[i].db;
    size_t missing = 0;
    for (const auto& [id, payload] : committed[i]) {
      auto found = now[i].find(id);
      missing += found == now[i].end() || found->second != payload;
    }
    EXPECT_EQ(missing, 0u) << db << ": of " << committed[i].size() << " rows seen";
    EXPECT_EQ(restarted.rows(db, "PRAGMA integrity_check"),
              (std::vector<SXValue>{{{"integrity_check", "ok"}}}))
        << db;
    EXPECT_EQ(restarted.rows(db, "PRAGMA journal_mode")[0]["journal_mode"], "wal");
  }
  EXPECT_EQ(restarted.countInLog("moved it to"), 0u) << restarted.log();
  expectNewRowsLand(restarted, now);
}

TEST(CrashSafetyEndToEnd, DamagedStoresAreMovedAsideAndRecreated) {
  SXTestTempDir state;
  const std::string garbage(8192, '\x5a');
  std::ofstream(state.file("tallyvane.db"), std::ios::binary) << garbage;
  std::ofstream(state.file("fernreporting.db"), std::ios::binary) << "not a database at all";
  // A directory where the file should be: SQLite cannot open it, whoever we run as.
  std::filesystem::create_directories(state.file("joulebook.db/x"));

  TestDaemon daemon({.stateDir = state.file("")});
  EXPECT_TRUE(daemon.waitForLog("moved it to", 3)) << daemon.log();
  EXPECT_GE(daemon.countInLog("<3>"), 3u);  // error level
  for (const Store& store : kStores) {
    auto aside = filesStartingWith(state.file(""), std::string(store.db) + ".damaged-");
    ASSERT_EQ(aside.size(), 1u) << store.db;
  }
  EXPECT_EQ(
      SXTestReadFile(state.file(filesStartingWith(state.file(""), "tallyvane.db.damaged-")[0])),
      garbage);
  // It serves and stores. (That a restart moves no healthy store, KillNineUnderLoad... checks.)
  expectNewRowsLand(daemon, {});
}
