// Production log facility. Where lines go is chosen once, at construction:
//   kJournal   the journal's native protocol, when the journal is attached to stderr
//              (JOURNAL_STREAM names stderr's device and inode): MESSAGE, PRIORITY,
//              SYSLOG_IDENTIFIER=sxreportingd and, for a scoped line, SXR_SCOPE,
//              SXR_SUBSYSTEM and SXR_CATEGORY, so that `journalctl SXR_SCOPE=sxrr` filters;
//   kPrefixed  stderr lines prefixed with their syslog priority ("<5>" default, "<6>" info,
//              "<3>" error, "<7>" debug), for a pipe or a file read by a log collector;
//   kPlain     bare stderr lines, for a person at a terminal.
// A line the journal refuses goes to stderr, prefixed.
//
// Stderr lines are handed to a writer thread, which writes whatever has gathered in one
// write(2): a burst of lines (a broadcast logs one per client) costs one system call, not one
// per line, and no caller waits for the disk or the pipe unless a megabyte is already
// waiting. Lines keep their order.
#pragma once

#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <string>
#include <thread>

#include "common/SXThreadSafety.h"
#include "platform/Log.h"

class SXStderrLog final : public SXLogFacility {
 public:
  enum class Output { kJournal, kPrefixed, kPlain };

  // `levels`: "sxrs=5,sxrr=5" names the level at which each scope is enabled. Scopes not
  // named are enabled up to level 0 (verbose lines off).
  explicit SXStderrLog(std::string_view levels, Output output = outputFor(2));
  // Writes what is still waiting.
  ~SXStderrLog() override;

  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override;
  bool isEnabled(const SXLogScope* scope, int level) const override;
  void write(const SXLogScope* scope, SXLogLevel level, std::string_view line) override;
  void flush() override;

  // Parses "name=level,..."; returns false on a malformed entry.
  static bool parseLevels(std::string_view text, std::map<std::string, int>& out);
  // The output that suits descriptor `fd` as stderr, given the environment's JOURNAL_STREAM.
  static Output outputFor(int fd);

 private:
  bool writeToJournal(const SXLogScope* scope, int priority, std::string_view line);
  void writeWaiting();

  static constexpr size_t kMaxWaitingBytes = 1 << 20;
  static constexpr size_t kBatchBytes = 64 << 10;
  static constexpr std::chrono::milliseconds kLinger{2};

  std::map<std::string, int> levels_;  // immutable after construction
  const Output output_;
  SXMutex mutex_;
  std::condition_variable wake_;     // lines waiting, or stopping
  std::condition_variable written_;  // a batch is out
  std::string waiting_ SX_GUARDED_BY(mutex_);
  uint64_t linesQueued_ SX_GUARDED_BY(mutex_) = 0;
  uint64_t linesWritten_ SX_GUARDED_BY(mutex_) = 0;
  int flushWaiters_ SX_GUARDED_BY(mutex_) = 0;
  bool stopping_ SX_GUARDED_BY(mutex_) = false;
  std::thread writer_ SX_GUARDED_BY(mutex_);  // started by the first line
};
