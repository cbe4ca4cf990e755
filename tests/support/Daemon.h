// The real daemon binary, started on a socket and stores in a temporary directory, for
// end-to-end tests. Its stderr goes to a file the test can search.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "support/SqliteTestSupport.h"
#include "sxreporting/client.h"

class TestDaemon {
 public:
  struct Options {
    std::vector<std::string> extraArgs = {};  // e.g. {"--log-scope", "sxrs=5"}
    SXValue device = nullptr;                 // device.json, when not null
    SXValue fernConfig = nullptr;             // fernreporting.json, when not null
    // Driver counters present at start-up: "<group>/<subgroup>/<channel>" -> value.
    std::map<std::string, int64_t> counters = {};
    // The stores' directory, when not the daemon's own temporary one: a second daemon started
    // on the same directory finds the first one's stores.
    std::string stateDir = {};
    // Variables set for the daemon process alone (LD_PRELOAD, say), beside the test's own.
    std::map<std::string, std::string> environment = {};
    SXValue daemonConfig = nullptr;  // sxreportingd.json, when not null
    bool waitForReady = true;        // false for a daemon expected not to start
  };

  // Writes a driver counter file under the kestrel root.
  void setCounter(const std::string& channelPath, int64_t value) const;
  // Writes a file of the configuration directory, e.g. "fernreporting.json".
  void writeConfig(const std::string& name, const SXValue& value) const;

  TestDaemon();
  explicit TestDaemon(Options options);
  ~TestDaemon();  // kills the daemon if it still runs

  const std::string& socket() const { return socket_; }
  std::string dir(const std::string& name) const { return dir_.file(name); }

  // A connected client; fails the test when it cannot connect.
  std::unique_ptr<SXReportingClient> client() const;

  // The daemon's log so far.
  std::string log() const;
  // Waits until the log holds `fragment` `times` times; false after `timeout`.
  bool waitForLog(const std::string& fragment, size_t times = 1,
                  std::chrono::milliseconds timeout = std::chrono::seconds(15)) const;
  // How often `fragment` is in the log once the lines already logged are written.
  size_t countInLog(const std::string& fragment) const;

  // Waits for the daemon to exit; its exit status (128 + the signal that killed it), or nothing
  // after `timeout`.
  std::optional<int> waitForExit(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  pid_t pid() const { return pid_; }

  // Rows of a query on one of the stores, e.g. rows("tallyvane.db", "SELECT ...").
  std::vector<SXValue> rows(const std::string& db, const std::string& sql) const;
  // Waits until the query returns at least `count` rows.
  std::vector<SXValue> waitForRows(
      const std::string& db, const std::string& sql, size_t count,
      std::chrono::milliseconds timeout = std::chrono::seconds(15)) const;

  // Runs sxreportctl against this daemon; returns its exit status and fills `output`.
  int ctl(const std::vector<std::string>& args, std::string* output = nullptr) const;
  // Starts sxreportctl against this daemon, its output and errors discarded; returns its pid.
  pid_t spawnCtl(const std::vector<std::string>& args) const;

 private:
  SXTestTempDir dir_;
  std::string stateDir_;
  std::string socket_;
  pid_t pid_ = -1;
  std::optional<int> exitStatus_;
};

// A process's resident set in KiB (VmRSS), or -1 when it cannot be read.
long residentKiB(pid_t pid);

// `word` quoted for the shell.
std::string shellQuoted(const std::string& word);
// Runs `command` through the shell; its exit status (-1 when it did not exit) and its standard
// output.
struct CommandRun {
  int status = -1;
  std::string output;
};
CommandRun runCommand(const std::string& command);

// The value of a call that must have been answered; fails the test otherwise.
template <typename T>
T replied(std::future<SXCallResult<T>> future) {
  auto result = future.get();
  EXPECT_EQ(result.status, SXCallStatus::kReplied) << result.error;
  return result.value;
}

// Clients that each pipeline sends, at most `window` unanswered, until stopped or until their
// connection ends. Every message is `payload` with "xid": <unique id>; the flood records the id
// of every send answered as delivered.
class TestFlood {
 public:
  struct Sender {
    std::unique_ptr<SXReportingClient> client;
    std::optional<std::vector<int64_t>> reporterIDs;  // nothing: a broadcast
  };

  TestFlood(std::vector<Sender> senders, size_t window, SXValue payload = SXValue::object());
  ~TestFlood() { stop(); }

  // Sends no more; waits for the answers still to come (or the end of their connection).
  void stop();
  size_t acknowledgedCount() const;
  std::set<int64_t> acknowledged() const;
  // The sender a message id belongs to.
  static size_t senderOf(int64_t xid) { return static_cast<size_t>(xid / kIdsPerSender); }
  // How many rows of `table` in `db` (a table with payload_json) carry each message id.
  static std::map<int64_t, size_t> stored(const TestDaemon& daemon, const std::string& db,
                                          const std::string& table);

 private:
  static constexpr int64_t kIdsPerSender = 1'000'000'000;
  void run(const Sender& sender, int64_t firstId);

  const size_t window_;
  const SXValue payload_;
  const std::vector<Sender> senders_;
  std::vector<std::thread> threads_;
  std::atomic<bool> stop_{false};
  mutable SXMutex mutex_;
  std::set<int64_t> acknowledged_ SX_GUARDED_BY(mutex_);
};
