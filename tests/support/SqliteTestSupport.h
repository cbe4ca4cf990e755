// Temporary directories, whole files and direct SQL access for the tests.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "sqlite/SqliteConnection.h"

// Polls `ready` until it holds or `timeout` passes.
inline bool waitUntil(const std::function<bool()>& ready,
                      std::chrono::milliseconds timeout = std::chrono::seconds(15)) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!ready()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

// A fresh directory under the system's temporary directory, removed with everything in it.
class SXTestTempDir {
 public:
  SXTestTempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "sxr-test-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) ADD_FAILURE() << "mkdtemp failed";
    path_ = pattern;
  }
  ~SXTestTempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  SXTestTempDir(const SXTestTempDir&) = delete;
  SXTestTempDir& operator=(const SXTestTempDir&) = delete;

  const std::string& path() const { return path_; }
  std::string file(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// The whole of a file ("" when it cannot be read).
inline std::string SXTestReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Every row `sql` returns, read through a connection of its own.
inline std::vector<SXValue> SXTestQuery(const std::string& dbPath, const std::string& sql) {
  auto db = SXSqliteConnection::open(dbPath, SXSqliteConnection::Mode::kReadOnly,
                                     std::chrono::seconds(5), "");
  SXSqliteStatement statement;
  std::vector<SXValue> rows;
  SXStatus failed = db.ok() ? (*db)->prepare(sql, statement) : db.status();
  if (failed.ok()) failed = statement.query({}, rows);
  if (!failed.ok()) ADD_FAILURE() << failed.error();
  return rows;
}

// Runs `sql` through a connection of its own.
inline void SXTestExec(const std::string& dbPath, const std::string& sql) {
  auto db = SXSqliteConnection::open(dbPath, SXSqliteConnection::Mode::kReadWrite,
                                     std::chrono::seconds(5), "");
  SXStatus failed = db.ok() ? (*db)->exec(sql) : db.status();
  if (!failed.ok()) ADD_FAILURE() << failed.error();
}

// Holds the write lock of a database until destroyed, as another process's writer would.
class SXTestWriteLock {
 public:
  explicit SXTestWriteLock(const std::string& dbPath) {
    auto db = SXSqliteConnection::open(dbPath, SXSqliteConnection::Mode::kReadWrite,
                                       std::chrono::seconds(5), "");
    SXStatus failed = db.ok() ? (*db)->exec("BEGIN EXCLUSIVE") : db.status();
    if (!failed.ok()) ADD_FAILURE() << failed.error();
    if (db.ok()) db_ = std::move(*db);
  }
  ~SXTestWriteLock() {
    if (db_) (void)db_->exec("ROLLBACK");
  }

 private:
  std::unique_ptr<SXSqliteConnection> db_;
};
