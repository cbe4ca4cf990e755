#include "sqlite/SqliteBatchWriter.h"

#include <gtest/gtest.h>

#include <future>

#include "fakes/FakeLog.h"
#include "support/SqliteTestSupport.h"

using namespace std::chrono_literals;

namespace {

class SqliteBatchWriterTest : public ::testing::Test {
 protected:
  SXSqliteBatchWriter::Options Options(size_t maxQueued, size_t maxBatch) {
    return {.path = dir_.file("rows.db"),
            .schema = "CREATE TABLE IF NOT EXISTS rows(id INTEGER PRIMARY KEY, v INTEGER)",
            .insertSql = "INSERT INTO rows(v) VALUES (?1)",
            .rowNoun = "rows",
            .threadName = "test-writer",
            .maxQueued = maxQueued,
            .maxBatch = maxBatch};
  }
  static SXSqliteBatchWriter::RowProducer Value(int64_t v) {
    return [v] { return SXSqliteRow{v}; };
  }
  // Holds the writer thread in a batch whose first row is `v` until open_ is set, so that what
  // is queued next waits behind it.
  void Hold(SXSqliteBatchWriter& writer, int64_t v) {
    std::promise<void> busy;
    ASSERT_TRUE(writer.enqueue([&busy, open = open_.get_future().share(), v] {
      busy.set_value();
      open.wait_for(20s);
      return SXSqliteRow{v};
    }));
    ASSERT_EQ(busy.get_future().wait_for(20s), std::future_status::ready);
  }
  std::vector<int64_t> Stored() {
    std::vector<int64_t> values;
    for (const SXValue& row : SXTestQuery(dir_.file("rows.db"), "SELECT v FROM rows ORDER BY id")) {
      values.push_back(row["v"]);
    }
    return values;
  }

  SXTestTempDir dir_;
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
  std::promise<void> open_;
};

// The callers bound what they queue; a queue that fills all the same must never make a caller
// wait (the callers are the server queue and the I/O thread), so it drops and counts. Each batch
// is one transaction: a row that cannot be bound fails its whole batch, and only that batch.
TEST_F(SqliteBatchWriterTest, AFullQueueRefusesNewRowsAtOnceAndEachBatchIsOneTransaction) {
  SXSqliteBatchWriter writer(Options(3, 2), log_);
  ASSERT_NO_FATAL_FAILURE(Hold(writer, 0));
  // Queued behind the held batch: [1, bad] then [3].
  EXPECT_TRUE(writer.enqueue(Value(1)));
  EXPECT_TRUE(writer.enqueue([] { return SXSqliteRow{int64_t(2), int64_t(2)}; }));  // 2 values
  EXPECT_TRUE(writer.enqueue(Value(3)));
  EXPECT_FALSE(writer.enqueue(Value(4)));
  EXPECT_FALSE(writer.enqueue(Value(5)));
  EXPECT_EQ(writer.writeErrors(), 2u);
  EXPECT_EQ(log_->countContaining("3 rows wait to be written; dropping new ones"), 1u);

  open_.set_value();
  writer.flush();
  EXPECT_TRUE(writer.enqueue(Value(6)));
  writer.flush();
  EXPECT_EQ(Stored(), (std::vector<int64_t>{0, 3, 6}));
  EXPECT_TRUE(log_->contains("dropped 2 rows"));
  EXPECT_EQ(writer.writeErrors(), 4u);
}

// A batch goes in multi-row statements and single rows; neither may reorder or shift rows.
TEST_F(SqliteBatchWriterTest, ALargeBatchKeepsItsOrderAndARowOfTheWrongWidthFailsOnlyItsBatch) {
  SXSqliteBatchWriter writer(Options(1000, 40), log_);
  ASSERT_NO_FATAL_FAILURE(Hold(writer, 0));
  // Behind the held row: a batch of 40 (two blocks and eight single rows), then one whose
  // sixth row has no value, inside its first block.
  std::vector<int64_t> expected = {0};
  for (int64_t v = 1; v <= 80; ++v) {
    EXPECT_TRUE(writer.enqueue(v == 46 ? [] { return SXSqliteRow{}; } : Value(v)));
    if (v <= 40) expected.push_back(v);
  }
  open_.set_value();
  writer.flush();
  EXPECT_EQ(Stored(), expected);
  EXPECT_TRUE(log_->contains("dropped 40 rows"));
  EXPECT_TRUE(log_->contains("a row of 0 values for 1 columns"));
}

TEST_F(SqliteBatchWriterTest, TheWriterMayOutliveItsOwnerWhenAProducerHeldIt) {
  auto writer = std::make_shared<SXSqliteBatchWriter>(Options(100, 1000), log_);
  // The producer ends up holding the only reference: the writer is destroyed on its own thread.
  std::weak_ptr<SXSqliteBatchWriter> weak = writer;
  writer->enqueue([holder = writer, open = open_.get_future().share()] {
    open.wait_for(20s);
    return SXSqliteRow{int64_t(1)};
  });
  writer->enqueue(Value(2));
  writer.reset();
  open_.set_value();
  EXPECT_TRUE(waitUntil([&] { return weak.expired(); }));
  waitUntil([&] { return Stored().size() >= 2; });
  EXPECT_EQ(Stored(), (std::vector<int64_t>{1, 2}));
}

}  // namespace
