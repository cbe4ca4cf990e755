// Stores that cannot be opened: what is moved aside, what never is, and the write-error counts.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "fakes/FakeLog.h"
#include "platform/SqliteFernReporting.h"
#include "platform/SqliteJoulebook.h"
#include "platform/SqliteTallyvane.h"
#include "support/SqliteTestSupport.h"

namespace {

using namespace std::chrono_literals;

const char* kSchema = "CREATE TABLE IF NOT EXISTS t(x)";

std::vector<std::string> entries(const std::string& dir) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

std::string contents(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

}  // namespace

TEST(SqliteRecovery, DamagedFilesAreMovedAsideWithTheirLogsAndReplaced) {
  SXTestTempDir dir;
  std::string path = dir.file("store.db");
  std::ofstream(path, std::ios::binary) << std::string(4096, 'G');
  std::ofstream(path + "-wal", std::ios::binary) << "stale log";
  std::string error, recovered;
  auto db = SXSqliteConnection::openOrRecover(path, 1s, kSchema, error, recovered);
  ASSERT_TRUE(db) << error;
  EXPECT_NE(recovered.find("cannot open " + path), std::string::npos) << recovered;
  EXPECT_NE(recovered.find("file is not a database"), std::string::npos) << recovered;
  EXPECT_NE(recovered.find(" and started a new store"), std::string::npos) << recovered;
  EXPECT_FALSE(db->exec("INSERT INTO t VALUES (1)"));

  auto names = entries(dir.file(""));
  auto aside = std::find_if(names.begin(), names.end(), [](const std::string& n) {
    return n.rfind("store.db.damaged-", 0) == 0 && n.find("-wal") == std::string::npos;
  });
  ASSERT_NE(aside, names.end());
  EXPECT_EQ(contents(dir.file(*aside)), std::string(4096, 'G'));
  // The old log goes with its file (or SQLite drops it), never into the new store.
  EXPECT_EQ(contents(path + "-wal").find("stale log"), std::string::npos);
  EXPECT_NE(recovered.find(dir.file(*aside)), std::string::npos);

  // A second damage the same second gets a name of its own.
  db.reset();
  std::filesystem::remove(path + "-wal");
  std::filesystem::remove(path + "-shm");
  std::ofstream(path, std::ios::binary | std::ios::trunc) << std::string(4096, 'H');
  recovered.clear();
  ASSERT_TRUE(SXSqliteConnection::openOrRecover(path, 1s, kSchema, error, recovered)) << error;
  EXPECT_FALSE(recovered.empty());
  size_t moved = 0;
  for (const auto& n : entries(dir.file(""))) {
    moved += n.rfind("store.db.damaged-", 0) == 0 && n.find("-wal") == std::string::npos &&
             n.find("-shm") == std::string::npos;
  }
  EXPECT_EQ(moved, 2u);
}

TEST(SqliteRecovery, WhatIsNotTheFilesFaultIsNeverMovedAside) {
  SXTestTempDir dir;
  std::string error, recovered;
  // A missing directory: nothing to move, the open just fails.
  EXPECT_FALSE(SXSqliteConnection::openOrRecover(dir.file("none/store.db"), 1s, kSchema, error,
                                                 recovered));
  EXPECT_TRUE(recovered.empty());
  EXPECT_NE(error.find("cannot open"), std::string::npos);

  // A healthy store opens as it is, even while another connection holds its write lock.
  std::string path = dir.file("store.db");
  {
    auto db = SXSqliteConnection::openOrRecover(path, 1s, kSchema, error, recovered);
    ASSERT_TRUE(db) << error;
    ASSERT_FALSE(db->exec("INSERT INTO t VALUES (7)"));
  }
  SXTestWriteLock lock(path);
  auto db = SXSqliteConnection::openOrRecover(path, 100ms, kSchema, error, recovered);
  EXPECT_TRUE(recovered.empty()) << recovered;
  EXPECT_EQ(entries(dir.file("")).size(), 3u);  // store.db, -wal, -shm
  EXPECT_EQ(SXTestQuery(path, "SELECT x FROM t").size(), 1u);
}

TEST(SqliteRecovery, StoresLogTheMoveAndCountRowsTheyCouldNotWrite) {
  SXTestTempDir dir;
  auto log = std::make_shared<FakeLog>();
  std::ofstream(dir.file("tallyvane.db"), std::ios::binary) << std::string(2048, 'x');
  {
    SXSqliteTallyvane events(dir.file("tallyvane.db"), log);
    EXPECT_TRUE(events.sendEventLazy("e", [] { return SXValue{{"k", 1}}; }));
    events.flush();
    EXPECT_EQ(events.writeErrors(), 0u);
  }
  EXPECT_TRUE(log->contains("and started a new store"));
  EXPECT_EQ(SXTestQuery(dir.file("tallyvane.db"), "SELECT id FROM events").size(), 1u);

  // A store in a directory that does not exist: every row is lost and counted.
  SXSqliteJoulebook power(dir.file("gone/joulebook.db"), log);
  for (int i = 0; i < 3; ++i) power.logRegisteredEvent(1, "e", SXValue::object(), std::nullopt);
  power.flush();
  EXPECT_EQ(power.writeErrors(), 3u);

  SXSqliteFernReporting spool(dir.file("gone/fern.db"), dir.file("none.json"), log);
  std::optional<FernError> error;
  EXPECT_FALSE(spool.sendOneMessage({}, {}, 1, 1, SXValue::object(), error));
  EXPECT_FALSE(spool.openSession({}, {}, {}));
  EXPECT_EQ(spool.writeErrors(), 2u);
}
