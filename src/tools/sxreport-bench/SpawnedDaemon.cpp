#include "SpawnedDaemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

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

bool SpawnedDaemon::start(const std::string& daemonPath, bool keepDirectory, std::string& error) {
  keep_ = keepDirectory;
  std::string pattern = (std::filesystem::temp_directory_path() / "sxreport-bench-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) {
    error = "cannot create a temporary directory";
    return false;
  }
  dir_ = pattern;
  for (const char* sub : {"lib", "etc", "run", "kestrel", "diag"}) {
    std::filesystem::create_directories(dir_ + "/" + sub);
  }
  socket_ = dir_ + "/run/sxr.sock";
  std::vector<std::string> args = {daemonPath,       "--socket",        socket_,
                                   "--state-dir",    dir_ + "/lib",     "--config-dir",
                                   dir_ + "/etc",    "--runtime-dir",   dir_ + "/run",
                                   "--kestrel-root", dir_ + "/kestrel", "--diagnostic-logs-dir",
                                   dir_ + "/diag"};
  std::string logPath = dir_ + "/daemon.log";
  pid_ = ::fork();
  if (pid_ == 0) {
    int fd = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
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
    if (readFile(dir_ + "/daemon.log").find("ready, listening on") != std::string::npos) {
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
  std::string text = readFile(dir_ + "/daemon.log");
  return text.size() > bytes ? text.substr(text.size() - bytes) : text;
}
