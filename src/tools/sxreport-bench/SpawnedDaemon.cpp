#include "SpawnedDaemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>
#include <vector>

namespace {

using namespace std::chrono_literals;

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

}  // namespace

std::string SpawnedDaemon::besideExecutable() {
  std::error_code ec;
  auto self = std::filesystem::read_symlink("/proc/self/exe", ec);
  if (ec) return "sxreportingd";
  return (self.parent_path() / "sxreportingd").string();
}

bool SpawnedDaemon::start(const std::string& daemonPath, bool keepDirectory,
                          const std::vector<DaemonFlag>& flags, std::string& error) {
  keep_ = keepDirectory;
  daemonPath_ = daemonPath;
  std::string pattern = (std::filesystem::temp_directory_path() / "sxreport-bench-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) {
    error = "cannot create a temporary directory";
    return false;
  }
  dir_ = pattern;
  for (const char* sub : {"lib", "etc", "run", "kestrel", "diag"}) {
    std::filesystem::create_directories(dir_ + "/" + sub);
  }
  // The stores' retention caps (256 MiB each by default) would delete rows that a long run
  // then counts as missing, and the pruning would be counted in the run's CPU.
  std::ofstream(dir_ + "/etc/sxreportingd.json")
      << R"({"retention": {"analytics": {"maxBytes": 1099511627776},)"
         R"( "powerLog": {"maxBytes": 1099511627776}, "spool": {"maxBytes": 1099511627776}}})";
  socket_ = dir_ + "/run/sxr.sock";
  std::vector<DaemonFlag> remaining = flags;
  // Each round either starts the daemon or drops one refused optional flag.
  for (size_t round = 0; round <= flags.size(); ++round) {
    if (launch(remaining, error)) return true;
    if (pid_ > 0) return false;  // it started but never became ready
    // "unknown option --NAME", or from daemons of the hand-written parser "bad option --NAME
    // VALUE" before their usage text, so the whole (short) log is searched.
    std::string log = readFile(logPath());
    auto refused = std::find_if(remaining.begin(), remaining.end(), [&](const DaemonFlag& flag) {
      return flag.optional &&
             (log.find("unknown option " + flag.name + "\n") != std::string::npos ||
              log.find("bad option " + flag.name + " ") != std::string::npos);
    });
    if (refused == remaining.end()) return false;
    refused_.push_back(*refused);
    remaining.erase(refused);
  }
  return false;
}

bool SpawnedDaemon::launch(const std::vector<DaemonFlag>& flags, std::string& error) {
  std::vector<std::string> args = {daemonPath_,      "--socket",        socket_,
                                   "--state-dir",    dir_ + "/lib",     "--config-dir",
                                   dir_ + "/etc",    "--runtime-dir",   dir_ + "/run",
                                   "--kestrel-root", dir_ + "/kestrel", "--diagnostic-logs-dir",
                                   dir_ + "/diag"};
  for (const auto& flag : flags) {
    args.push_back(flag.name);
    args.push_back(flag.value);
  }
  std::string log = logPath();
  pid_ = ::fork();
  if (pid_ == 0) {
    int fd = ::open(log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ::dup2(fd, STDERR_FILENO);
    ::dup2(fd, STDOUT_FILENO);
    std::vector<char*> argv;
    for (auto& arg : args) argv.push_back(arg.data());
    argv.push_back(nullptr);
    ::execv(argv[0], argv.data());
    ::_exit(127);
  }
  if (pid_ < 0) {
    error = "cannot fork";
    return false;
  }
  return waitForReady(error);
}

bool SpawnedDaemon::waitForReady(std::string& error) {
  auto deadline = std::chrono::steady_clock::now() + 30s;
  while (std::chrono::steady_clock::now() < deadline) {
    if (readFile(logPath()).find("ready, listening on") != std::string::npos) {
      return true;
    }
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      error = "the daemon exited before it was ready:\n" + logTail();
      return false;
    }
    std::this_thread::sleep_for(10ms);
  }
  error = "the daemon was not ready within 30 s:\n" + logTail();
  return false;
}

void SpawnedDaemon::terminate() {
  if (pid_ <= 0) return;
  ::kill(pid_, SIGTERM);
  auto deadline = std::chrono::steady_clock::now() + 5s;
  int status = 0;
  while (::waitpid(pid_, &status, WNOHANG) == 0) {
    if (std::chrono::steady_clock::now() > deadline) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, &status, 0);
      break;
    }
    std::this_thread::sleep_for(10ms);
  }
  pid_ = -1;
}

SpawnedDaemon::~SpawnedDaemon() {
  terminate();
  if (!dir_.empty() && !keep_) {
    std::error_code ignored;
    std::filesystem::remove_all(dir_, ignored);
  }
}

std::string SpawnedDaemon::logTail(size_t bytes) const {
  // Only the tail is read: a daemon under abuse may have written gigabytes.
  std::ifstream in(logPath(), std::ios::binary | std::ios::ate);
  if (!in) return "";
  auto size = static_cast<size_t>(std::max<std::streamoff>(0, in.tellg()));
  size_t from = size > bytes ? size - bytes : 0;
  in.seekg(static_cast<std::streamoff>(from));
  std::string text(size - from, '\0');
  in.read(text.data(), static_cast<std::streamsize>(text.size()));
  text.resize(static_cast<size_t>(std::max<std::streamsize>(0, in.gcount())));
  return text;
}

std::optional<uint64_t> SpawnedDaemon::logBytes() const {
  std::error_code ec;
  auto size = std::filesystem::file_size(logPath(), ec);
  if (ec) return std::nullopt;
  return static_cast<uint64_t>(size);
}
