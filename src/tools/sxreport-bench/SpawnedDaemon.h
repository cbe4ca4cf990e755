// A daemon started by the benchmark on a socket and stores of its own in a fresh temporary
// directory, which goes away with the object (unless kept). The daemon's stderr goes to
// daemon.log there.
//
// Threads: one owner.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "BenchOptions.h"

class SpawnedDaemon {
 public:
  SpawnedDaemon() = default;
  ~SpawnedDaemon();  // terminates the daemon, removes the directory unless kept
  SpawnedDaemon(const SpawnedDaemon&) = delete;
  SpawnedDaemon& operator=(const SpawnedDaemon&) = delete;

  // Starts `daemonPath` with `flags` after its own and waits for its ready line. An optional
  // flag the daemon refuses as a bad option is dropped (see refusedFlags()) and the daemon
  // started again. On failure returns false and says why.
  bool start(const std::string& daemonPath, bool keepDirectory,
             const std::vector<DaemonFlag>& flags, std::string& error);
  // Ends the daemon (SIGTERM, then SIGKILL after a grace period).
  void terminate();

  pid_t pid() const { return pid_; }
  const std::string& socket() const { return socket_; }
  std::string stateDir() const { return dir_ + "/lib"; }
  const std::string& directory() const { return dir_; }
  std::string logPath() const { return dir_ + "/daemon.log"; }
  // Bytes the daemon has written to its log (stdout and stderr), if it can be read.
  std::optional<uint64_t> logBytes() const;
  // The optional flags this daemon did not know, and so runs without.
  const std::vector<DaemonFlag>& refusedFlags() const { return refused_; }
  // The last lines of the daemon's log, for error messages.
  std::string logTail(size_t bytes = 2000) const;

  // sxreportingd beside the running executable.
  static std::string besideExecutable();

 private:
  bool launch(const std::vector<DaemonFlag>& flags, std::string& error);
  bool waitForReady(std::string& error);

  std::string dir_;
  std::string socket_;
  std::string daemonPath_;
  std::vector<DaemonFlag> refused_;
  pid_t pid_ = -1;
  bool keep_ = false;
};
