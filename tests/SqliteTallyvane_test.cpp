// The analytics store and the power log, both written by a batch writer of their own.
#include "platform/SqliteTallyvane.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

#include "fakes/FakeLog.h"
#include "platform/SqliteJoulebook.h"
#include "support/SqliteTestSupport.h"

using namespace std::chrono_literals;

namespace {

class SqliteTallyvaneTest : public ::testing::Test {
 protected:
  SXTestTempDir dir_;
  std::string db_ = dir_.file("tallyvane.db");
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
};

SXPayloadProvider Returning(SXValue value) {
  return [value = std::move(value)] { return value; };
}

TEST_F(SqliteTallyvaneTest, EventsLandWithNameTimeAndPayload) {
  double before = SXSqliteNow();
  {
    SXSqliteTallyvane tallyvane(db_, log_);
    SXValue payload = {{"count", 3}, {"nested", {{"list", {1, 2.5, "x"}}}}, {"flag", true}};
    EXPECT_TRUE(tallyvane.sendEventLazy("com.vendra.sonex.Error.Error", Returning(payload)));
    EXPECT_TRUE(tallyvane.sendEventLazy("empty", Returning(SXValue::object())));
    tallyvane.flush();
    auto rows = SXSqliteTallyvane::readEvents(db_, std::nullopt, 0);
    ASSERT_EQ(rows.size(), 2u);
    EXPECT_EQ(rows[0]["name"], "com.vendra.sonex.Error.Error");
    EXPECT_EQ(rows[0]["payload"], payload);
    EXPECT_EQ(rows[1]["name"], "empty");
    EXPECT_EQ(rows[1]["payload"], SXValue::object());
    EXPECT_LT(rows[0]["id"].get<int64_t>(), rows[1]["id"].get<int64_t>());
    double time = rows[0]["time"].get<double>();
    EXPECT_GE(time, before);
    EXPECT_LE(time, SXSqliteNow());
  }
  EXPECT_TRUE(log_->lines().empty());
}

TEST_F(SqliteTallyvaneTest, PayloadsThatAreNotPlainJsonAreStillStored) {
  SXSqliteTallyvane tallyvane(db_, log_);
  tallyvane.sendEventLazy("bad-utf8", Returning({{"s", std::string("a\xff"
                                                                   "b")}}));
  tallyvane.sendEventLazy("binary", Returning({{"b", SXValue::binary({1, 2})}}));
  tallyvane.sendEventLazy("throws", []() -> SXValue { throw std::runtime_error("boom"); });
  tallyvane.sendEventLazy("no-provider", nullptr);
  tallyvane.flush();
  auto rows = SXTestQuery(db_, "SELECT name, payload_json FROM events ORDER BY id");
  ASSERT_EQ(rows.size(), 3u);
  EXPECT_EQ(rows[0]["payload_json"],
            "{\"s\":\"a\xEF\xBF\xBD"
            "b\"}");
  EXPECT_EQ(rows[1]["payload_json"], "{\"b\":{\"bytes\":[1,2],\"subtype\":null}}");
  EXPECT_EQ(rows[2]["name"], "no-provider");
  EXPECT_EQ(rows[2]["payload_json"], "null");
  EXPECT_TRUE(log_->contains("boom"));
}

TEST_F(SqliteTallyvaneTest, ATextProviderIsStoredAsItIsAndTheDictionaryIsNeverBuilt) {
  SXSqliteTallyvane tallyvane(db_, log_);
  bool built = false;
  tallyvane.sendEventLazy(
      "e",
      [&]() -> SXValue {
        built = true;
        return SXValue::object();
      },
      [] { return std::string(R"({"a":1})"); });
  tallyvane.flush();
  auto rows = SXTestQuery(db_, "SELECT payload_json FROM events");
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0]["payload_json"], R"({"a":1})");
  EXPECT_FALSE(built);
}

TEST_F(SqliteTallyvaneTest, LazySendReturnsBeforeTheProviderRunsOnAnotherThread) {
  SXSqliteTallyvane tallyvane(db_, log_);
  std::promise<void> sent;
  std::shared_future<void> sentFuture = sent.get_future().share();
  std::promise<std::pair<bool, std::thread::id>> ran;
  auto ranFuture = ran.get_future();
  bool accepted = tallyvane.sendEventLazy("lazy", [&, sentFuture] {
    // Called on our own thread this would wait in vain; the wait is bounded so a fault fails.
    bool sendReturnedFirst = sentFuture.wait_for(10s) == std::future_status::ready;
    ran.set_value({sendReturnedFirst, std::this_thread::get_id()});
    return SXValue{{"k", 1}};
  });
  sent.set_value();
  EXPECT_TRUE(accepted);
  ASSERT_EQ(ranFuture.wait_for(20s), std::future_status::ready);
  auto [sendReturnedFirst, thread] = ranFuture.get();
  EXPECT_TRUE(sendReturnedFirst);
  EXPECT_NE(thread, std::this_thread::get_id());
  tallyvane.flush();
  EXPECT_EQ(SXSqliteTallyvane::readEvents(db_, "lazy", 0).size(), 1u);
}

TEST_F(SqliteTallyvaneTest, FlushCommitsEverythingFromManyThreadsInOrder) {
  constexpr int kThreads = 4;
  constexpr int kPerThread = 2500;
  SXSqliteTallyvane tallyvane(db_, log_);
  std::vector<std::thread> senders;
  for (int t = 0; t < kThreads; ++t) {
    senders.emplace_back([&, t] {
      for (int i = 0; i < kPerThread; ++i) {
        tallyvane.sendEventLazy("t" + std::to_string(t), Returning({{"i", i}}));
      }
    });
  }
  for (auto& s : senders) s.join();
  tallyvane.flush();
  for (int t = 0; t < kThreads; ++t) {
    auto rows = SXSqliteTallyvane::readEvents(db_, "t" + std::to_string(t), 0);
    ASSERT_EQ(rows.size(), size_t(kPerThread));
    for (int i = 0; i < kPerThread; ++i) ASSERT_EQ(rows[i]["payload"]["i"], i);
  }
}

TEST_F(SqliteTallyvaneTest, ClosingWritesWhatIsQueuedAndReopeningKeepsIt) {
  {
    SXSqliteTallyvane tallyvane(db_, log_);
    for (int i = 0; i < 3; ++i) tallyvane.sendEventLazy("first", Returning(i));
  }  // no flush: the destructor drains
  {
    SXSqliteTallyvane tallyvane(db_, log_);
    tallyvane.sendEventLazy("second", Returning(3));
  }
  auto rows = SXSqliteTallyvane::readEvents(db_, std::nullopt, 0);
  ASSERT_EQ(rows.size(), 4u);
  for (int i = 0; i < 4; ++i) EXPECT_EQ(rows[i]["payload"], i);
  EXPECT_EQ(rows[3]["name"], "second");
}

TEST_F(SqliteTallyvaneTest, ReadEventsFiltersByNameAndKeepsTheNewest) {
  {
    SXSqliteTallyvane tallyvane(db_, log_);
    for (const char* name : {"a.one", "b.one", "a.two", "a.three"}) {
      tallyvane.sendEventLazy(name, Returning(name));
    }
  }
  auto names = [](const std::vector<SXValue>& rows) {
    std::vector<std::string> out;
    for (const auto& r : rows) out.push_back(r["name"]);
    return out;
  };
  EXPECT_EQ(names(SXSqliteTallyvane::readEvents(db_, "a.two", 0)),
            std::vector<std::string>{"a.two"});
  EXPECT_EQ(names(SXSqliteTallyvane::readEvents(db_, "a.*", 2)),
            (std::vector<std::string>{"a.two", "a.three"}));
  EXPECT_EQ(names(SXSqliteTallyvane::readEvents(db_, std::nullopt, 1)),
            std::vector<std::string>{"a.three"});

  auto absent =
      SXSqliteTallyvane::readEvents(dir_.file("absent.db"), std::nullopt, 0, std::nullopt);
  EXPECT_FALSE(absent.ok());
  EXPECT_NE(absent.error().find("absent.db"), std::string::npos) << absent.error();
}

TEST_F(SqliteTallyvaneTest, AStoreThatCannotBeOpenedLogsAndDropsEvents) {
  db_ = dir_.file("missing/store.db");  // its directory is missing: nothing to move aside
  SXSqliteTallyvane tallyvane(db_, log_);
  EXPECT_TRUE(log_->contains("cannot open"));
  EXPECT_TRUE(tallyvane.sendEventLazy("lost", Returning(1)));
  tallyvane.flush();
  EXPECT_TRUE(log_->contains("dropped 1 events"));
  for (const auto& line : log_->lines()) EXPECT_EQ(line.level, SXLogLevel::kError);
}

TEST_F(SqliteTallyvaneTest, AFailedWriteDropsItsBatchAndLaterEventsAreWritten) {
  SXSqliteTallyvane tallyvane(db_, log_, 20ms);
  tallyvane.sendEventLazy("before", Returning(1));
  tallyvane.flush();
  {
    SXTestWriteLock lock(db_);
    tallyvane.sendEventLazy("while-locked", Returning(2));
    tallyvane.flush();
  }
  ASSERT_EQ(log_->lines().size(), 1u);
  EXPECT_TRUE(log_->contains("dropped 1 events"));
  EXPECT_TRUE(log_->contains("database is locked"));
  tallyvane.sendEventLazy("after", Returning(3));
  tallyvane.flush();
  auto rows = SXSqliteTallyvane::readEvents(db_, std::nullopt, 0);
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0]["name"], "before");
  EXPECT_EQ(rows[1]["name"], "after");
}

TEST(SqliteJoulebook, EntriesLandWithClientEventAndPayload) {
  SXTestTempDir dir;
  auto log = std::make_shared<FakeLog>();
  double before = SXSqliteNow();
  SXSqliteJoulebook joulebook(dir.file("joulebook.db"), log);
  SXValue entry = {{"EngineOnDuration", 12.5}, {"ApplicationName", "app"}, {"TimestampEnd", 1000}};
  joulebook.logRegisteredEvent(28, "Flumen_Haptics", entry, std::nullopt);
  // The entry is taken whole at the call: later changes by the caller do not reach the log.
  entry["ApplicationName"] = "changed";
  joulebook.logRegisteredEvent(-1, "Other", SXValue::object(), SXValue{{"filter", 1}});
  joulebook.flush();

  auto rows = SXTestQuery(dir.file("joulebook.db"),
                          "SELECT time, client_id, event, payload_json FROM entries ORDER BY id");
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0]["client_id"], 28);
  EXPECT_EQ(rows[0]["event"], "Flumen_Haptics");
  EXPECT_EQ(
      SXValue::parse(rows[0]["payload_json"].get<std::string>()),
      (SXValue{{"EngineOnDuration", 12.5}, {"ApplicationName", "app"}, {"TimestampEnd", 1000}}));
  EXPECT_GE(rows[0]["time"].get<double>(), before);
  EXPECT_LE(rows[0]["time"].get<double>(), SXSqliteNow());
  EXPECT_EQ(rows[1]["client_id"], -1);
  EXPECT_EQ(rows[1]["payload_json"], "{}");
  EXPECT_TRUE(log->lines().empty());
}

}  // namespace
