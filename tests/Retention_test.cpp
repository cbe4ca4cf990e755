#include "sqlite/Retention.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <thread>

#include "export/OtlpSpoolReader.h"
#include "fakes/FakeLog.h"
#include "linux/AsioDispatch.h"
#include "sqlite/SqliteFernReporting.h"
#include "sqlite/SqliteJoulebook.h"
#include "sqlite/SqliteTallyvane.h"
#include "support/Daemon.h"
#include "support/SqliteTestSupport.h"

namespace {

constexpr double kDay = 86400;

std::shared_ptr<SXRetention> Retention(const SXTestTempDir& dir, SXRetentionPolicy policy,
                                       bool spoolExported = false,
                                       std::shared_ptr<FakeLog> log = nullptr) {
  // One dispatch for the whole run, never destroyed: a timer task may hold the last reference
  // to a retention, and a dispatch must not be destroyed from one of its own threads.
  static auto* dispatch = new std::shared_ptr<SXDispatch>(std::make_shared<SXAsioDispatch>());
  auto retention = SXRetention::create({.stateDir = dir.path(),
                                        .diagnosticLogsDir = dir.file("logs"),
                                        .dispatch = *dispatch,
                                        .log = log,
                                        .pruning = {.chunkRows = 50}},
                                       policy);
  retention->setSpoolExported(spoolExported);
  return retention;
}

// ---- policy

struct PolicyCase {
  const char* json;
  const char* error;  // "" when the section is good
  std::function<void(SXRetentionPolicy&)> expected = [](SXRetentionPolicy&) {};
};

TEST(RetentionPolicy, TheSectionSetsWhatItNamesAndRefusesAnythingElse) {
  const PolicyCase cases[] = {
      {"null", ""},
      {R"({"analytics": {"maxAgeDays": 7}})", "",
       [](SXRetentionPolicy& p) { p.analytics.maxAgeDays = 7; }},
      {R"({"intervalSeconds": 0.5, "spool": {"maxBytes": 1024}, "powerLog": {"maxAgeDays": 1.5},
          "summaryFiles": {"maxFiles": 10}, "damagedCopies": {"maxAgeDays": 2}})",
       "",
       [](SXRetentionPolicy& p) {
         p.intervalSeconds = 0.5;
         p.spool.maxBytes = 1024;
         p.powerLog.maxAgeDays = 1.5;
         p.summaryFiles.maxFiles = 10;
         p.damagedCopies.maxAgeDays = 2;
       }},
      {R"({"analytics": {"maxBytes": -1}})",
       "retention.analytics.maxBytes: expected a positive integer, got -1"},
      {R"({"intervalSeconds": "60"})",
       "retention.intervalSeconds: expected a positive number, got \"60\""},
      {R"({"spool": {"maxAge": 3}})",
       "retention.spool: unknown key \"maxAge\" (expected maxAgeDays, maxBytes)"},
      {R"({"analytics": 5})", "retention.analytics: expected an object, got 5"},
  };
  for (const PolicyCase& c : cases) {
    SCOPED_TRACE(c.json);
    auto policy = SXRetentionPolicy::fromJson(SXValue::parse(c.json));
    EXPECT_EQ(policy.error(), c.error);
    EXPECT_EQ(policy.ok(), *c.error == '\0');
    SXRetentionPolicy expected;
    c.expected(expected);
    if (policy.ok()) {
      EXPECT_EQ(*policy, expected);
    }
  }
}

// ---- stores

// Writes rows n .. n + count - 1 (payload {"n": n, "pad": ...}) through the store's adapter and
// returns once they are committed; false when one could not be stored.
using RowWriter = std::function<bool(int64_t n, int64_t count)>;

struct StoreCase {
  const char* name;  // as in status
  const char* file;
  const char* table;
  SXStoreRetention SXRetentionPolicy::*limits;
  std::function<RowWriter(const std::string& path)> open;
};

SXValue Row(int64_t n) { return {{"n", n}, {"pad", std::string(1000, 'x')}}; }

const StoreCase kStoreCases[] = {
    {"tallyvane", "tallyvane.db", "events", &SXRetentionPolicy::analytics,
     [](const std::string& path) -> RowWriter {
       auto store = std::make_shared<SXSqliteTallyvane>(path, nullptr);
       return [store](int64_t n, int64_t count) {
         for (int64_t i = n; i < n + count; ++i) {
           store->sendEventLazy("e", [i] { return Row(i); });
         }
         store->flush();
         return store->writeErrors() == 0;
       };
     }},
    {"joulebook", "joulebook.db", "entries", &SXRetentionPolicy::powerLog,
     [](const std::string& path) -> RowWriter {
       auto store = std::make_shared<SXSqliteJoulebook>(path, nullptr);
       return [store](int64_t n, int64_t count) {
         for (int64_t i = n; i < n + count; ++i) store->logRegisteredEvent(1, "e", Row(i), {});
         store->flush();
         return store->writeErrors() == 0;
       };
     }},
    {"fernreporting", "fernreporting.db", "messages", &SXRetentionPolicy::spool,
     [](const std::string& path) -> RowWriter {
       auto store = std::make_shared<SXSqliteFernReporting>(path, path + ".json", nullptr);
       return [store](int64_t n, int64_t count) {
         bool stored = true;
         for (int64_t i = n; i < n + count; ++i) {
           std::optional<FernError> error;
           stored = store->sendOneMessage({}, {}, 3, 1, Row(i), error) && stored;
         }
         return stored;
       };
     }},
};

class RetentionStoreTest : public ::testing::TestWithParam<StoreCase> {
 protected:
  const StoreCase& store = GetParam();
  SXTestTempDir dir;
  const std::string db = dir.file(store.file);
  RowWriter write = store.open(db);
};

TEST_P(RetentionStoreTest, AFullStoreComesBackUnderItsCapOldestFirstWhileAWriterGoesOn) {
  // About a megabyte, past both limits: 20 aged rows, then 980 young ones.
  ASSERT_TRUE(write(0, 20));
  SXTestExec(db, std::string("UPDATE ") + store.table + " SET time = time - 40 * 86400");
  ASSERT_TRUE(write(20, 980));

  constexpr uint64_t kCap = 256 * 1024;
  SXRetentionPolicy policy;
  policy.*store.limits = {30, kCap};
  auto retention = Retention(dir, policy);
  std::atomic<int64_t> written{1000};
  std::atomic<bool> stop{false}, failed{false};
  std::thread writer([&] {
    while (!stop) {
      if (!write(written, 1)) failed = true;
      ++written;
      written.notify_all();
      // A steady stream rather than a flood, which would only make the next pass longer.
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
  });
  // The pruner lets writers in by pausing between its transactions, so how much the writer
  // gets done during a pass is a matter of time: its rate then is held against its own rate
  // just before, on the same machine under the same load, not against a figure.
  auto rowsPerSecond = [&](const std::function<void()>& meanwhile) {
    const int64_t first = written;
    const auto from = std::chrono::steady_clock::now();
    meanwhile();
    return (written - first) /
           std::chrono::duration<double>(std::chrono::steady_clock::now() - from).count();
  };
  for (int64_t now; (now = written) < 1001;) written.wait(now);  // the writer is going
  const double alone = rowsPerSecond([&] {
    for (int64_t target = written + 100, now; (now = written) < target;) written.wait(now);
  });
  const double withPass = rowsPerSecond([&] { retention->runPass(); });
  stop = true;
  writer.join();
  retention->runPass();  // and what the writer added meanwhile

  EXPECT_FALSE(failed);
  EXPECT_GE(withPass, alone / 4) << "the writer was held up: " << withPass
                                 << " rows/s during the pass, " << alone << " alone";
  const SXValue left = SXTestQuery(db, std::string("SELECT MIN(payload_json ->> 'n') AS first, "
                                                    "MAX(payload_json ->> 'n') AS last, "
                                                    "COUNT(*) AS count FROM ") +
                                            store.table)[0];
  const int64_t first = left["first"], last = left["last"], count = left["count"];
  EXPECT_EQ(last, written - 1);        // the newest are kept
  EXPECT_EQ(count, last - first + 1);  // and only the oldest went
  EXPECT_GT(first, 20);                // the aged rows among them
  EXPECT_GT(count, 100);               // not more than the cap needs
  const uint64_t used = SXTestQuery(db,
                                    "SELECT (p.page_count - f.freelist_count) * s.page_size AS n "
                                    "FROM pragma_page_count() p, pragma_freelist_count() f, "
                                    "pragma_page_size() s")[0]["n"];
  EXPECT_LE(used, kCap);
  EXPECT_EQ(retention->counters()["rows_pruned"][store.name], written - count);
  EXPECT_EQ(retention->gauges()["store_bytes"][store.name], used);
  // Incremental vacuum gave the pages back: the file is not much larger than what it holds.
  EXPECT_LT(std::filesystem::file_size(db), 2 * kCap);
}

INSTANTIATE_TEST_SUITE_P(Stores, RetentionStoreTest, ::testing::ValuesIn(kStoreCases),
                         [](const auto& info) { return std::string(info.param.name); });

// ---- spool

struct SpoolCase {
  bool exported;   // "otlp-http" is a backend
  int64_t cursor;  // how far the exporter has got
  std::vector<int64_t> messagesLeft;
  std::vector<int64_t> sessionsLeft;
};

TEST(RetentionSpool, MessagesGoOnceTheExporterHasThemAndSessionsOnceNoMessageNeedsThem) {
  const SpoolCase cases[] = {
      {true, 6, {7, 8, 9, 10}, {1, 4}},
      {true, 10, {10}, {1, 4}},  // the newest stays, so that message ids never come back
      // Nothing takes them: only the caps apply.
      {false, 10, {1, 2, 3, 4, 5, 6, 7, 8, 9, 10}, {1, 2, 4}},
  };
  for (const SpoolCase& c : cases) {
    SCOPED_TRACE(testing::Message() << "exported " << c.exported << ", cursor " << c.cursor);
    SXTestTempDir dir;
    const std::string db = dir.file("fernreporting.db");
    SXSqliteFernReporting spool(db, dir.file("fernreporting.json"), nullptr);
    // Sessions 1 to 3 and a flush are old, 4 is new. Session 2 has the first two messages, 1
    // the others, 3 none.
    auto withMessages = spool.openSession({}, {}, {});
    auto first = spool.openSession({}, {}, {});
    spool.openSession({}, {}, {});
    for (int i = 0; i < 10; ++i) {
      std::optional<FernError> error;
      ASSERT_TRUE((i < 2 ? first : withMessages)->sendMessage(3, 1, {{"n", i}}, error));
    }
    withMessages->flushMessages(nullptr);
    withMessages->flushMessages(nullptr);
    SXTestExec(db,
               "UPDATE sessions SET time = time - 40 * 86400; "
               "UPDATE flushes SET time = time - 40 * 86400 WHERE id = 1");
    auto fresh = spool.openSession({}, {}, {});
    SXOtlpSpoolReader reader(db);
    ASSERT_TRUE(reader.advance(c.cursor).ok());

    Retention(dir, SXRetentionPolicy(), c.exported)->runPass();

    auto ids = [&](const std::string& table) {
      std::vector<int64_t> left;
      for (const SXValue& row : SXTestQuery(db, "SELECT id FROM " + table))
        left.push_back(row["id"]);
      return left;
    };
    EXPECT_EQ(ids("messages"), c.messagesLeft);
    EXPECT_EQ(ids("sessions"), c.sessionsLeft);
    EXPECT_EQ(ids("flushes"), std::vector<int64_t>{2});
    std::optional<FernError> error;
    ASSERT_TRUE(withMessages->sendMessage(3, 1, {{"n", 10}}, error));
    EXPECT_EQ(ids("messages").back(), 11);
  }
}

// ---- files

void WriteFile(const std::string& path, double ageSeconds) {
  std::ofstream(path) << "{}";
  std::filesystem::last_write_time(path, std::filesystem::file_time_type::clock::now() -
                                             std::chrono::seconds(int64_t(ageSeconds)));
}

std::string DamagedName(const std::string& store, double ageSeconds) {
  const time_t when = static_cast<time_t>(SXSqliteNow() - ageSeconds);
  std::tm utc{};
  gmtime_r(&when, &utc);
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%Y%m%d-%H%M%S", &utc);
  return store + ".damaged-" + stamp;
}

TEST(RetentionFiles, OldSummariesAndDamagedCopiesGoAndSummariesAreCapped) {
  SXTestTempDir dir;
  std::filesystem::create_directories(dir.file("logs"));
  WriteFile(dir.file("logs/20261001-000000-sonex-a-telephony.json"), 40 * kDay);
  WriteFile(dir.file("logs/20261124-010000-sonex-a-alarms.json"), 3 * 3600);
  WriteFile(dir.file("logs/20261124-020000-sonex-b-alarms.json"), 2 * 3600);
  WriteFile(dir.file("logs/20261124-030000-sonex-c-alarms.json"), 1 * 3600);
  WriteFile(dir.file("logs/notes.json"), 40 * kDay);  // not a summary: never touched
  // Damaged copies are dated by their names, not by their files' times.
  const std::string old = DamagedName("tallyvane.db", 31 * kDay);
  WriteFile(dir.file(old), 0);
  WriteFile(dir.file(old + "-wal"), 0);
  const std::string recent = DamagedName("joulebook.db", 29 * kDay);  // named once: the clock moves
  WriteFile(dir.file(recent), 40 * kDay);

  SXRetentionPolicy policy;
  policy.summaryFiles.maxFiles = 2;
  auto log = std::make_shared<FakeLog>();
  auto retention = Retention(dir, policy, false, log);
  retention->runPass();

  std::set<std::string> left;
  for (const auto& sub : {dir.path(), dir.file("logs")}) {
    for (const auto& entry : std::filesystem::directory_iterator(sub)) {
      if (entry.is_regular_file()) left.insert(entry.path().filename().string());
    }
  }
  EXPECT_EQ(left,
            (std::set<std::string>{"20261124-020000-sonex-b-alarms.json",
                                   "20261124-030000-sonex-c-alarms.json", "notes.json", recent}));
  EXPECT_EQ(retention->counters()["files_aged_out"], (SXValue{{"summary", 2}, {"damaged", 2}}));
  EXPECT_TRUE(log->contains("retention: removed 2 summary files and 2 damaged store files"));
}

// Age alone, over more old rows than one chunk holds (every store: AFullStoreComesBack...).
TEST(RetentionTimer, PassesRunOnTheirOwnAndANewPolicyAppliesToTheNext) {
  SXTestTempDir dir;
  RowWriter write = kStoreCases[0].open(dir.file("tallyvane.db"));
  ASSERT_TRUE(write(0, 120));
  SXTestExec(dir.file("tallyvane.db"), "UPDATE events SET time = time - 40 * 86400");
  ASSERT_TRUE(write(120, 10));
  SXRetentionPolicy policy;
  policy.intervalSeconds = 0.05;
  auto retention = Retention(dir, policy);
  auto pruned = [&] { return retention->counters()["rows_pruned"]["tallyvane"].get<int64_t>(); };
  retention->start();
  EXPECT_TRUE(waitUntil([&] { return pruned() == 120; })) << pruned();
  EXPECT_EQ(SXTestQuery(dir.file("tallyvane.db"), "SELECT MIN(id) AS id FROM events")[0]["id"],
            121);

  policy.analytics.maxAgeDays = 1e-6;  // a tenth of a second
  retention->setPolicy(policy);
  EXPECT_TRUE(waitUntil([&] { return pruned() == 129; })) << pruned();  // all but the newest
  retention->stop();
}

}  // namespace
