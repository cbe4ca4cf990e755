// The analytics store, written by a batch writer of its own: what it stores of odd payloads,
// that sends never wait for it, reading back, and failures. (Events landing, and the power
// log, are checked through the daemon: e2e/Messages, e2e/CrashSafety.)
#include "sqlite/SqliteTallyvane.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

#include "fakes/FakeLog.h"
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

TEST_F(SqliteTallyvaneTest, PayloadsAreBuiltLaterOnTheWriterAndStoredEvenIfNotPlainJson) {
  SXSqliteTallyvane tallyvane(db_, log_);
  tallyvane.sendEventLazy("bad-utf8", Returning({{"s", std::string("a\xff"
                                                                   "b")}}));
  tallyvane.sendEventLazy("binary", Returning({{"b", SXValue::binary({1, 2})}}));
  tallyvane.sendEventLazy("throws", []() -> SXValue { throw std::runtime_error("boom"); });
  tallyvane.sendEventLazy("no-provider", nullptr);
  // A text provider is stored as it is, and the dictionary is never built.
  bool built = false;
  tallyvane.sendEventLazy(
      "text",
      [&]() -> SXValue {
        built = true;
        return SXValue::object();
      },
      [] { return std::make_shared<const std::string>(R"({"a":1})"); });
  // The send returns before the provider runs, on another thread.
  std::promise<void> sent;
  std::thread::id ranOn;
  EXPECT_TRUE(tallyvane.sendEventLazy("lazy", [&, sent = sent.get_future().share()] {
    // Called on our own thread this would wait in vain; the wait is bounded so a fault fails.
    EXPECT_EQ(sent.wait_for(10s), std::future_status::ready);
    ranOn = std::this_thread::get_id();
    return SXValue::object();
  }));
  sent.set_value();
  tallyvane.flush();
  EXPECT_NE(ranOn, std::this_thread::get_id());
  auto rows = SXTestQuery(db_, "SELECT name, payload_json FROM events ORDER BY id");
  ASSERT_EQ(rows.size(), 5u);
  EXPECT_EQ(rows[0]["payload_json"],
            "{\"s\":\"a\xEF\xBF\xBD"
            "b\"}");
  EXPECT_EQ(rows[1]["payload_json"], "{\"b\":{\"bytes\":[1,2],\"subtype\":null}}");
  EXPECT_EQ(rows[2]["name"], "no-provider");
  EXPECT_EQ(rows[2]["payload_json"], "null");
  EXPECT_EQ(rows[3]["payload_json"], R"({"a":1})");
  EXPECT_FALSE(built);
  EXPECT_TRUE(log_->contains("boom"));
}

// A store that cannot be opened, or a write that fails, drops events with an error; events
// sent later are written.
TEST_F(SqliteTallyvaneTest, FailuresDropEventsWithAnErrorAndLaterEventsAreWritten) {
  {
    SXSqliteTallyvane lost(dir_.file("missing/store.db"), log_);  // nothing to move aside
    EXPECT_TRUE(log_->contains("cannot open"));
    EXPECT_TRUE(lost.sendEventLazy("lost", Returning(1)));
    lost.flush();
    EXPECT_TRUE(log_->contains("dropped 1 events"));
  }
  SXSqliteTallyvane tallyvane(db_, log_, 20ms);
  tallyvane.sendEventLazy("before", Returning(1));
  tallyvane.flush();
  const size_t before = log_->lines().size();
  {
    SXTestWriteLock lock(db_);
    tallyvane.sendEventLazy("while-locked", Returning(2));
    tallyvane.flush();
  }
  ASSERT_EQ(log_->lines().size(), before + 1);
  EXPECT_TRUE(log_->contains("database is locked"));
  for (const auto& line : log_->lines()) EXPECT_EQ(line.level, SXLogLevel::kError);
  tallyvane.sendEventLazy("after", Returning(3));
  tallyvane.flush();
  auto rows = SXSqliteTallyvane::readEvents(db_, std::nullopt, 0);
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_EQ(rows[0]["name"], "before");
  EXPECT_EQ(rows[1]["name"], "after");
}

}  // namespace
