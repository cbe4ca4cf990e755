#include "platform/SqliteJoulebook.h"

#include <gtest/gtest.h>

#include "fakes/FakeLog.h"
#include "support/SqliteTestSupport.h"

using namespace std::chrono_literals;

namespace {

class SqliteJoulebookTest : public ::testing::Test {
 protected:
  std::vector<SXValue> Entries() {
    return SXTestQuery(db_,
                       "SELECT id, time, client_id, event, payload_json FROM entries "
                       "ORDER BY id");
  }

  SXTestTempDir dir_;
  std::string db_ = dir_.file("joulebook.db");
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
};

TEST_F(SqliteJoulebookTest, EntriesLandWithClientEventAndPayload) {
  double before = SXSqliteNow();
  SXSqliteJoulebook joulebook(db_, log_);
  SXValue entry = {{"EngineOnDuration", 12.5}, {"ApplicationName", "app"}, {"TimestampEnd", 1000}};
  joulebook.logRegisteredEvent(28, "Flumen_Haptics", entry, std::nullopt);
  // The entry is taken whole at the call: later changes by the caller do not reach the log.
  entry["ApplicationName"] = "changed";
  joulebook.logRegisteredEvent(-1, "Other", SXValue::object(), SXValue{{"filter", 1}});
  joulebook.flush();

  auto rows = Entries();
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
  EXPECT_TRUE(log_->lines().empty());
}

TEST_F(SqliteJoulebookTest, ClosingWritesWhatIsQueuedAndReopeningKeepsIt) {
  {
    SXSqliteJoulebook joulebook(db_, log_);
    for (int i = 0; i < 500; ++i) joulebook.logRegisteredEvent(28, "e", {{"i", i}}, std::nullopt);
  }
  {
    SXSqliteJoulebook joulebook(db_, log_);
    joulebook.logRegisteredEvent(28, "e", {{"i", 500}}, std::nullopt);
  }
  auto rows = Entries();
  ASSERT_EQ(rows.size(), 501u);
  for (int i = 0; i < 501; ++i) {
    ASSERT_EQ(SXValue::parse(rows[i]["payload_json"].get<std::string>())["i"], i);
  }
}

TEST_F(SqliteJoulebookTest, FailingStoresLogAndKeepWorking) {
  db_ = dir_.file("missing/store.db");  // its directory is missing: nothing to move aside
  SXSqliteJoulebook joulebook(db_, log_, 20ms);
  EXPECT_TRUE(log_->contains("cannot open"));
  joulebook.logRegisteredEvent(28, "lost", SXValue::object(), std::nullopt);
  joulebook.flush();
  EXPECT_TRUE(log_->contains("dropped 1 power-log entries"));

  // Once the store can be opened, entries are written again.
  std::filesystem::create_directory(dir_.file("missing"));
  joulebook.logRegisteredEvent(28, "kept", SXValue::object(), std::nullopt);
  joulebook.flush();
  {
    SXTestWriteLock lock(db_);
    joulebook.logRegisteredEvent(28, "lost", SXValue::object(), std::nullopt);
    joulebook.flush();
  }
  joulebook.logRegisteredEvent(28, "kept", SXValue::object(), std::nullopt);
  joulebook.flush();
  auto rows = Entries();
  ASSERT_EQ(rows.size(), 2u);
  for (const auto& row : rows) EXPECT_EQ(row["event"], "kept");
  EXPECT_TRUE(log_->contains("database is locked"));
  EXPECT_EQ(log_->lines().size(), 3u);
}

}  // namespace
