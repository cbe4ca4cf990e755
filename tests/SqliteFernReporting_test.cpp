#include "sqlite/SqliteFernReporting.h"

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <set>
#include <thread>

#include "fakes/FakeLog.h"
#include "support/SqliteTestSupport.h"

using namespace std::chrono_literals;

namespace {

using Backends = std::optional<std::vector<std::string>>;

class SqliteFernReportingTest : public ::testing::Test {
 protected:
  std::unique_ptr<SXSqliteFernReporting> Make(std::chrono::milliseconds busy = 5s) {
    return std::make_unique<SXSqliteFernReporting>(db_, config_, log_, busy);
  }
  void WriteConfig(const std::string& text) { std::ofstream(config_) << text; }

  static std::optional<FernError> Flush(FernReportingSession& session) {
    std::promise<std::optional<FernError>> done;
    session.flushMessages([&](std::optional<FernError> error) { done.set_value(error); });
    auto future = done.get_future();
    EXPECT_EQ(future.wait_for(20s), std::future_status::ready);
    return future.get();
  }

  SXTestTempDir dir_;
  std::string db_ = dir_.file("fernreporting.db");
  std::string config_ = dir_.file("fernreporting.json");
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
};

TEST_F(SqliteFernReportingTest, BackendsComeFromTheConfigurationFile) {
  using List = std::vector<std::string>;
  const struct {
    const char* file;  // nullptr: absent
    List backends;
    bool logged;  // an error naming the file
  } rows[] = {
      {nullptr, {"spool"}, false},
      {R"({"backends": ["spool", "upload"]})", {"spool", "upload"}, false},
      {R"({"backends": []})", {}, false},
      {R"({"other": 1})", {"spool"}, false},
      {"{\"backends\": [", {"spool"}, true},
      {"[\"spool\"]", {"spool"}, true},
      {R"({"backends": ["spool", 3]})", {"spool"}, true},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.file ? row.file : "absent");
    if (row.file) WriteConfig(row.file);
    size_t before = log_->lines().size();
    EXPECT_EQ(Make()->backends(), row.backends);
    ASSERT_EQ(log_->lines().size(), before + row.logged);
    if (row.logged) {
      EXPECT_EQ(log_->lines().back().level, SXLogLevel::kError);
      EXPECT_TRUE(log_->contains("fernreporting.json"));
    }
  }
}

// Stores of the previous version had an index on messages(session_id) instead of session_refs.
TEST_F(SqliteFernReportingTest, AnOldStoreGetsItsSessionReferencesFromItsMessages) {
  SXTestExec(db_,
             "CREATE TABLE messages(id INTEGER PRIMARY KEY, time REAL, session_id INTEGER, "
             "session_info_json TEXT, user_info_json TEXT, category INTEGER, type INTEGER, "
             "payload_json TEXT);"
             "CREATE INDEX messages_session ON messages(session_id);"
             "INSERT INTO messages(id, session_id) VALUES (1, 1), (2, 2), (3, 1), (4, NULL)");
  Make();
  EXPECT_EQ(SXTestQuery(db_, "SELECT session_id AS s, last_message_id AS m FROM session_refs"),
            (std::vector<SXValue>{{{"s", 1}, {"m", 3}}, {{"s", 2}, {"m", 2}}}));
  EXPECT_TRUE(SXTestQuery(db_, "SELECT 1 FROM sqlite_master WHERE type = 'index'").empty());
}

TEST_F(SqliteFernReportingTest, TokensAreUniqueAndNameTheirParent) {
  auto fern = Make();
  std::set<std::string> seen;
  for (int i = 0; i < 100; ++i) seen.insert(fern->newHierarchyToken(nullptr)->identifier());
  seen.insert(Make()->newHierarchyToken(nullptr)->identifier());
  EXPECT_EQ(seen.size(), 101u);
  auto parent = fern->newHierarchyToken(nullptr);
  auto child = fern->newHierarchyToken(parent);
  EXPECT_EQ(child->identifier().rfind(parent->identifier() + "/", 0), 0u);
  EXPECT_GT(child->identifier().size(), parent->identifier().size() + 1);
}

TEST_F(SqliteFernReportingTest, ConcurrentSendsShareTransactionsYetEachIsCommittedOnReturn) {
  auto fern = Make();
  constexpr int kSessions = 6;
  constexpr int kPerSession = 160;
  constexpr int kBurst = 20;  // longer than one multi-row insert
  std::vector<std::shared_ptr<FernReportingSession>> sessions;
  for (int i = 0; i < kSessions; ++i) {
    sessions.push_back(fern->openSession({}, {}, {}));
    ASSERT_NE(sessions.back(), nullptr);
  }
  std::atomic<int> failures{0};
  std::vector<std::thread> senders;
  for (int s = 0; s < kSessions; ++s) {
    senders.emplace_back([&, s] {
      for (int i = 0; i < kPerSession; i += kBurst) {
        std::vector<SXValue> payloads;
        for (int k = 0; k < kBurst; ++k) payloads.push_back({{"i", i + k}});
        std::vector<FernMessage> burst;
        for (const SXValue& payload : payloads)
          burst.push_back({uint16_t(s), 1, &payload, nullptr});
        for (const FernSendOutcome& outcome : sessions[s]->sendMessages(burst)) {
          if (!outcome.sent) ++failures;
        }
        // Acknowledged means committed: another connection sees the rows at once.
        auto rows = SXTestQuery(
            db_, "SELECT COUNT(*) AS n FROM messages WHERE category = " + std::to_string(s));
        if (rows.empty() || rows[0]["n"] != i + kBurst) ++failures;
      }
    });
  }
  for (auto& sender : senders) sender.join();
  EXPECT_EQ(failures, 0);
  // Each session's reference is its newest message, whoever committed the transaction.
  EXPECT_EQ(SXTestQuery(db_,
                        "SELECT session_id, last_message_id FROM session_refs EXCEPT "
                        "SELECT session_id, MAX(id) FROM messages GROUP BY session_id"),
            std::vector<SXValue>{});
  // Each session's rows are all stored, in the order it sent them.
  EXPECT_EQ(SXTestQuery(db_, "SELECT COUNT(*) AS n FROM messages")[0]["n"],
            kSessions * kPerSession);
  EXPECT_EQ(SXTestQuery(db_,
                        "SELECT 1 FROM messages a JOIN messages b ON a.category = b.category "
                        "AND a.id < b.id AND json_extract(a.payload_json, '$.i') >= "
                        "json_extract(b.payload_json, '$.i')"),
            std::vector<SXValue>{});
}

// (A configuration without backends completes with none: LifecycleEndToEnd.NoBackends...)
TEST_F(SqliteFernReportingTest, SessionsConfigureOnAnotherThreadAndOutliveTheAdapter) {
  auto fern = Make();
  auto session = fern->openSession({}, {}, {});
  ASSERT_NE(session, nullptr);
  fern.reset();
  std::promise<std::pair<Backends, std::thread::id>> configured;
  session->startConfiguration([&](Backends backends) {
    configured.set_value({backends, std::this_thread::get_id()});
  });
  auto future = configured.get_future();
  ASSERT_EQ(future.wait_for(20s), std::future_status::ready);
  auto [backends, thread] = future.get();
  EXPECT_EQ(backends, (std::vector<std::string>{"spool"}));
  EXPECT_NE(thread, std::this_thread::get_id());
  std::optional<FernError> error;
  EXPECT_TRUE(session->sendMessage(1, 2, SXValue::object(), error));
  EXPECT_EQ(Flush(*session), std::nullopt);
  EXPECT_EQ(SXTestQuery(db_, "SELECT * FROM messages").size(), 1u);
}

// A store that cannot be opened, or one locked by another writer, refuses with a reason until
// it can be written again.
TEST_F(SqliteFernReportingTest, FailingStoresRefuseWithAReasonUntilTheyCanBeWritten) {
  db_ = dir_.file("missing/store.db");  // its directory is missing: nothing to move aside
  auto fern = Make(20ms);
  EXPECT_TRUE(log_->contains("cannot open"));
  EXPECT_EQ(fern->openSession({}, {}, {}), nullptr);
  EXPECT_TRUE(log_->contains("cannot store the session"));
  std::optional<FernError> error;
  EXPECT_FALSE(fern->sendOneMessage({}, {}, 1, 1, SXValue::object(), error));
  EXPECT_NE(error.value_or(FernError{}).localizedDescription.find("store.db"), std::string::npos);

  std::filesystem::create_directory(dir_.file("missing"));  // opened again on the next call
  auto session = fern->openSession({}, {}, {});
  ASSERT_NE(session, nullptr);
  {
    SXTestWriteLock lock(db_);
    error.reset();
    EXPECT_FALSE(session->sendMessage(1, 1, SXValue::object(), error));
    EXPECT_NE(error.value_or(FernError{}).localizedDescription.find("database is locked"),
              std::string::npos);
    EXPECT_NE(Flush(*session).value_or(FernError{}).localizedDescription.find("locked"),
              std::string::npos);
  }
  EXPECT_TRUE(session->sendMessage(1, 2, SXValue::object(), error));
  EXPECT_EQ(Flush(*session), std::nullopt);
  EXPECT_EQ(SXTestQuery(db_, "SELECT type FROM messages"), (std::vector<SXValue>{{{"type", 2}}}));
}

}  // namespace
