// Opening stores: what is moved aside, what never is, the write-error counts, and the one-time
// conversion to incremental vacuum.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>

#include "fakes/FakeLog.h"
#include "sqlite/SqliteTallyvane.h"
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

bool IsDamagedCopy(const std::string& name) {
  return name.starts_with("store.db.damaged-") && !name.ends_with("-wal") &&
         !name.ends_with("-shm");
}

// Sets or clears the immutable attribute; false where the file system or our privileges lack it.
bool setImmutable(const std::string& path, bool on) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  int flags = 0;
  bool ok = ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
  flags = on ? flags | FS_IMMUTABLE_FL : flags & ~FS_IMMUTABLE_FL;
  ok = ok && ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
  ::close(fd);
  return ok;
}

// Makes a file this process cannot write, undone when it goes out of scope (the temporary
// directory cannot be removed around an immutable file). Root writes any mode, so as root the
// file is made immutable instead of read-only.
struct UnwritableFile {
  explicit UnwritableFile(std::string file) : path(std::move(file)) {
    ok = ::geteuid() == 0 ? setImmutable(path, true) : ::chmod(path.c_str(), 0444) == 0;
  }
  ~UnwritableFile() { setImmutable(path, false); }

  std::string path;
  bool ok = false;
};

}  // namespace

TEST(SqliteRecovery, OnlyDamageIsMovedAsidePermissionsProblemsAreNot) {
  using F = SXSqliteOpenFailure;
  const SXSqliteFileProbe missing{};
  const SXSqliteFileProbe healthy{.exists = true, .regularFile = true, .accessErrno = 0};
  const SXSqliteFileProbe directory{.exists = true, .regularFile = false, .accessErrno = 0};
  auto failedWith = [](int errnum) {
    return SXSqliteFileProbe{.exists = true, .regularFile = true, .accessErrno = errnum};
  };
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_NOTADB, healthy), F::kDamaged);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_CORRUPT, healthy), F::kDamaged);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_CANTOPEN, directory), F::kDamaged);
  // Another user's file, a read-only or immutable one, one on a read-only mount.
  for (int errnum : {EACCES, EPERM, EROFS}) {
    EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_CANTOPEN, failedWith(errnum)), F::kNotWritable);
    EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_NOTADB, failedWith(errnum)), F::kNotWritable);
  }
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_READONLY, healthy), F::kNotWritable);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_READONLY_DIRECTORY, healthy), F::kNotWritable);
  // Failures that say nothing about the file.
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_CANTOPEN, healthy), F::kOther);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_CANTOPEN, missing), F::kOther);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_CANTOPEN, failedWith(EMFILE)), F::kOther);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_BUSY, healthy), F::kOther);
  EXPECT_EQ(SXSqliteClassifyOpenFailure(SQLITE_FULL, healthy), F::kOther);
}

TEST(SqliteRecovery, AStoreThisUserCannotWriteIsLeftInPlaceAndItsRowsCounted) {
  SXTestTempDir dir;
  std::string path = dir.file("tallyvane.db");
  std::string recovered;
  auto made = SXSqliteConnection::openOrRecover(path, 1s, kSchema, recovered);
  ASSERT_TRUE(made.ok()) << made.error();
  made->reset();  // closed before its mode changes
  for (const char* extra : {"-wal", "-shm"}) std::filesystem::remove(path + extra);
  UnwritableFile unwritable(path);
  if (!unwritable.ok) GTEST_SKIP() << "cannot make a file unwritable here";

  auto refused = SXSqliteConnection::openOrRecover(path, 1s, kSchema, recovered);
  EXPECT_FALSE(refused.ok());
  EXPECT_TRUE(recovered.empty()) << recovered;
  EXPECT_NE(refused.error().find("cannot open " + path + ": not writable by this user"),
            std::string::npos)
      << refused.error();
  EXPECT_EQ(entries(dir.file("")), std::vector<std::string>{"tallyvane.db"});

  auto log = std::make_shared<FakeLog>();
  {
    SXSqliteTallyvane events(path, log);
    for (int i = 0; i < 2; ++i) events.sendEventLazy("e", [] { return SXValue{{"k", 1}}; });
    events.flush();
    EXPECT_EQ(events.writeErrors(), 2u);
  }
  EXPECT_TRUE(log->contains("not writable by this user"));
  EXPECT_FALSE(log->contains("moved it to"));
  EXPECT_EQ(entries(dir.file("")), std::vector<std::string>{"tallyvane.db"});
}

// (On start-up, and a directory in a store's place: CrashSafetyEndToEnd.DamagedStoresAre...)
TEST(SqliteRecovery, DamagedFilesAreMovedAsideWithTheirLogsAndHealthyOnesNeverAre) {
  SXTestTempDir dir;
  std::string path = dir.file("store.db");
  std::string recovered;
  for (char fill : {'G', 'H'}) {  // a second damage the same second gets a name of its own
    std::ofstream(path, std::ios::binary | std::ios::trunc) << std::string(4096, fill);
    std::ofstream(path + "-wal", std::ios::binary | std::ios::trunc) << "stale log";
    std::filesystem::remove(path + "-shm");
    recovered.clear();
    auto db = SXSqliteConnection::openOrRecover(path, 1s, kSchema, recovered);
    ASSERT_TRUE(db.ok()) << db.error();
    EXPECT_NE(recovered.find("file is not a database"), std::string::npos) << recovered;
    // The old log goes with its file (or SQLite drops it), never into the new store.
    EXPECT_EQ(SXTestReadFile(path + "-wal").find("stale log"), std::string::npos);
    ASSERT_TRUE((*db)->exec("INSERT INTO t VALUES (7)").ok());
  }
  auto names = entries(dir.file(""));
  EXPECT_EQ(std::count_if(names.begin(), names.end(), IsDamagedCopy), 2);

  // A healthy store is never moved aside, even while another connection holds it locked. (A
  // missing directory just fails the open: SqliteTallyvaneTest.FailuresDropEvents...)
  SXTestWriteLock lock(path);
  const size_t files = entries(dir.file("")).size();
  recovered.clear();
  (void)SXSqliteConnection::openOrRecover(path, 100ms, kSchema, recovered);
  EXPECT_TRUE(recovered.empty()) << recovered;
  EXPECT_EQ(entries(dir.file("")).size(), files);
  EXPECT_EQ(SXTestQuery(path, "SELECT x FROM t").size(), 1u);
}

TEST(SqliteRecovery, AStoreMadeWithoutIncrementalVacuumIsConvertedOnceByItsOwner) {
  SXTestTempDir dir;
  std::string path = dir.file("store.db");
  sqlite3* raw = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &raw), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(raw, "CREATE TABLE t(x); INSERT INTO t VALUES (1), (2)", nullptr, nullptr,
                         nullptr),
            SQLITE_OK);
  sqlite3_close(raw);
  auto autoVacuum = [&](SXSqliteConnection& db) {
    auto mode = db.queryInt("PRAGMA auto_vacuum", {});
    EXPECT_TRUE(mode.ok()) << mode.error();
    return mode.ok() ? *mode : -1;
  };
  std::string recovered;
  // Other connections never convert: the copy would hold the store's writers up.
  auto other = SXSqliteConnection::open(path, SXSqliteConnection::Mode::kReadWrite, 1s, "");
  ASSERT_TRUE(other.ok()) << other.error();
  EXPECT_EQ(autoVacuum(**other), 0);
  other->reset();
  auto owner = SXSqliteConnection::openOrRecover(path, 1s, kSchema, recovered);
  ASSERT_TRUE(owner.ok()) << owner.error();
  EXPECT_EQ(autoVacuum(**owner), 2);  // incremental
  EXPECT_EQ(recovered, "");
  auto rows = (*owner)->queryInt("SELECT COUNT(*) FROM t", {});
  ASSERT_TRUE(rows.ok()) << rows.error();
  EXPECT_EQ(*rows, 2);
}
