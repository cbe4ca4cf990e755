#include "support/Daemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

bool waitUntil(const std::function<bool()>& ready, std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!ready()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

namespace {

void writeJson(const std::string& path, const SXValue& value) {
  std::ofstream(path) << value.dump();
}

// The test's environment with `extra` set over it, as "NAME=value" strings; built before the
// fork, since the child of a threaded process may not allocate.
std::vector<std::string> childEnvironment(const std::map<std::string, std::string>& extra) {
  std::vector<std::string> out;
  for (char** entry = environ; *entry; ++entry) {
    std::string text = *entry;
    if (!extra.count(text.substr(0, text.find('=')))) out.push_back(std::move(text));
  }
  for (const auto& [name, value] : extra) out.push_back(name + "=" + value);
  return out;
}

std::vector<char*> pointersTo(std::vector<std::string>& words) {
  std::vector<char*> out;
  for (auto& word : words) out.push_back(word.data());
  out.push_back(nullptr);
  return out;
}

}  // namespace

TestDaemon::TestDaemon() : TestDaemon(Options{}) {}

TestDaemon::TestDaemon(Options options) {
  for (const char* sub : {"lib", "etc", "run", "kestrel", "diag"}) {
    std::filesystem::create_directories(dir_.file(sub));
  }
  if (!options.device.is_null()) writeJson(dir_.file("etc/device.json"), options.device);
  if (!options.fernConfig.is_null()) writeConfig("fernreporting.json", options.fernConfig);
  if (!options.daemonConfig.is_null()) writeConfig("sxreportingd.json", options.daemonConfig);
  for (const auto& [path, value] : options.counters) setCounter(path, value);
  stateDir_ = options.stateDir.empty() ? dir_.file("lib") : options.stateDir;
  socket_ = dir_.file("run/sxr.sock");
  std::vector<std::string> args = {SXR_DAEMON_PATH,
                                   "--socket",
                                   socket_,
                                   "--state-dir",
                                   stateDir_,
                                   "--config-dir",
                                   dir_.file("etc"),
                                   "--runtime-dir",
                                   dir_.file("run"),
                                   "--kestrel-root",
                                   dir_.file("kestrel"),
                                   "--diagnostic-logs-dir",
                                   dir_.file("diag")};
  args.insert(args.end(), options.extraArgs.begin(), options.extraArgs.end());
  std::string logPath = dir_.file("daemon.log");
  std::vector<char*> argv = pointersTo(args);
  std::vector<int> passed = listeningSockets(options.activationSockets);
  if (!passed.empty()) {
    options.environment["LISTEN_FDS"] = std::to_string(passed.size());
    options.environment["LISTEN_PID"] = std::string(16, ' ');  // the child's, filled in there
  }
  std::vector<std::string> environment = childEnvironment(options.environment);
  std::vector<char*> envp = pointersTo(environment);
  pid_ = ::fork();
  if (pid_ == 0) {
    int fd = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ::dup2(fd, STDERR_FILENO);
    ::dup2(fd, STDOUT_FILENO);
    for (size_t i = 0; i < passed.size(); ++i) ::dup2(passed[i], 3 + static_cast<int>(i));
    for (char* entry : envp) {
      if (entry && std::strncmp(entry, "LISTEN_PID=", 11) == 0) {
        std::snprintf(entry + 11, 16, "%d", static_cast<int>(::getpid()));
      }
    }
    ::execve(argv[0], argv.data(), envp.data());
    ::_exit(127);
  }
  for (int fd : passed) ::close(fd);
  if (options.waitForReady && !waitForLog("ready, listening on")) {
    ADD_FAILURE() << "daemon did not start:\n" << log();
  }
}

// `count` listening Unix stream sockets, the first at socket(), each on a descriptor above
// those the child sets up, so that placing them at 3, 4, ... overwrites none of them.
std::vector<int> TestDaemon::listeningSockets(int count) const {
  std::vector<int> fds;
  for (int i = 0; i < count; ++i) {
    std::string path = i == 0 ? socket_ : socket_ + "." + std::to_string(i);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0) << path;
    EXPECT_EQ(::listen(fd, 16), 0);
    fds.push_back(::fcntl(fd, F_DUPFD_CLOEXEC, 64));
    ::close(fd);
  }
  return fds;
}

void TestDaemon::writeConfig(const std::string& name, const SXValue& value) const {
  writeJson(dir_.file("etc/" + name), value);
}

void TestDaemon::setCounter(const std::string& channelPath, int64_t value) const {
  std::string path = dir_.file("kestrel/" + channelPath);
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path) << value << "\n";
}

TestDaemon::~TestDaemon() {
  if (!exitStatus_ && pid_ > 0) {
    ::kill(pid_, SIGKILL);
    int status = 0;
    ::waitpid(pid_, &status, 0);
  }
}

std::unique_ptr<SXReportingClient> TestDaemon::client() const {
  SXClientOptions options;
  options.socketPath = socket_;
  options.defaultTimeout = std::chrono::seconds(10);
  auto client = std::make_unique<SXReportingClient>(options);
  std::string error;
  if (!client->connect(&error)) ADD_FAILURE() << "connect: " << error;
  return client;
}

std::string TestDaemon::log() const { return SXTestReadFile(dir_.file("daemon.log")); }

namespace {

size_t Occurrences(const std::string& text, const std::string& fragment) {
  size_t count = 0;
  for (size_t pos = text.find(fragment); pos != std::string::npos;
       pos = text.find(fragment, pos + fragment.size())) {
    ++count;
  }
  return count;
}

}  // namespace

size_t TestDaemon::countInLog(const std::string& fragment) const {
  // The daemon's log thread writes lines a moment after the work that logs them: count once
  // the log has stopped growing for a while (or has grown for a second).
  std::error_code ignored;
  auto size = [&] { return std::filesystem::file_size(dir_.file("daemon.log"), ignored); };
  auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(1);
  for (auto seen = size(); std::chrono::steady_clock::now() < giveUp;) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    auto now = size();
    if (now == seen) break;
    seen = now;
  }
  return Occurrences(log(), fragment);
}

bool TestDaemon::waitForLog(const std::string& fragment, size_t times,
                            std::chrono::milliseconds timeout) const {
  return waitUntil([&] { return Occurrences(log(), fragment) >= times; }, timeout);
}

std::optional<int> TestDaemon::waitForExit(std::chrono::milliseconds timeout) {
  if (exitStatus_) return exitStatus_;
  waitUntil(
      [&] {
        int status = 0;
        if (::waitpid(pid_, &status, WNOHANG) == pid_) {
          exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        }
        return exitStatus_.has_value();
      },
      timeout);
  return exitStatus_;
}

std::vector<SXValue> TestDaemon::rows(const std::string& db, const std::string& sql) const {
  if (!std::filesystem::exists(stateFile(db))) return {};
  return SXTestQuery(stateFile(db), sql);
}

std::vector<SXValue> TestDaemon::waitForRows(const std::string& db, const std::string& sql,
                                             size_t count,
                                             std::chrono::milliseconds timeout) const {
  std::vector<SXValue> found;
  waitUntil(
      [&] {
        found = rows(db, sql);
        return found.size() >= count;
      },
      timeout);
  return found;
}

int TestDaemon::ctl(const std::vector<std::string>& args, std::string* output) const {
  std::vector<std::string> words = {"--socket",      socket_,         "--state-dir",
                                    stateDir_,       "--config-dir",  dir_.file("etc"),
                                    "--runtime-dir", dir_.file("run")};
  words.insert(words.end(), args.begin(), args.end());
  std::string command = SXR_CTL_PATH;
  for (const auto& word : words) command += " " + shellQuoted(word);
  CommandRun run = runCommand(command + " 2>&1");
  if (output) *output = run.output;
  return run.status;
}

std::string shellQuoted(const std::string& word) {
  std::string text = "'";
  for (char c : word) text += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return text + "'";
}

CommandRun runCommand(const std::string& command) {
  CommandRun run;
  FILE* pipe = ::popen(command.c_str(), "r");
  if (!pipe) return run;
  char buf[4096];
  size_t n;
  while ((n = std::fread(buf, 1, sizeof buf, pipe)) > 0) run.output.append(buf, n);
  const int status = ::pclose(pipe);
  run.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return run;
}

pid_t TestDaemon::spawnCtl(const std::vector<std::string>& args) const {
  std::vector<std::string> argv = {SXR_CTL_PATH, "--socket", socket_};
  argv.insert(argv.end(), args.begin(), args.end());
  std::vector<char*> raw;
  for (auto& a : argv) raw.push_back(a.data());
  raw.push_back(nullptr);
  pid_t pid = ::fork();
  if (pid == 0) {
    int null = ::open("/dev/null", O_WRONLY);
    ::dup2(null, STDOUT_FILENO);
    ::execv(raw[0], raw.data());
    ::_exit(127);
  }
  return pid;
}

long residentKiB(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
  }
  return -1;
}

TestFlood::TestFlood(std::vector<Sender> senders, size_t window) : window_(window) {
  for (auto& sender : senders) {
    lanes_.push_back(std::make_unique<Lane>());
    lanes_.back()->sender = std::move(sender);
  }
  for (size_t i = 0; i < lanes_.size(); ++i) {
    threads_.emplace_back([this, i] { run(*lanes_[i], static_cast<int64_t>(i) * kIdsPerSender); });
  }
}

TestFlood::~TestFlood() {
  stop();
  // Answers still to come call back into this object: the clients go first.
  for (auto& lane : lanes_) lane->sender.client.reset();
}

void TestFlood::stop() {
  stop_ = true;
  for (auto& lane : lanes_) {
    SXMutexLock lock(lane->mutex);
    lane->room.notify_all();
  }
  for (auto& thread : threads_) thread.join();
  threads_.clear();
}

void TestFlood::run(Lane& lane, int64_t firstId) {
  for (int64_t xid = firstId; !stop_; ++xid) {
    {
      SXMutexLock lock(lane.mutex);
      lock.wait(lane.room, [&]() SX_REQUIRES(lane.mutex) {
        return stop_ || lane.lost || lane.unanswered < window_;
      });
      if (stop_ || lane.lost) return;
      ++lane.unanswered;
    }
    lane.sender.client->sendMessage(
        {{"xid", xid}}, 3, 1, lane.sender.reporterIDs,
        [this, &lane, xid](SXCallResult<std::optional<SXError>> result) {
          if (result.replied() && !result.value) {
            SXMutexLock lock(ackMutex_);
            acknowledged_[xid] = Clock::now();
          }
          SXMutexLock lock(lane.mutex);
          --lane.unanswered;
          if (result.status == SXCallStatus::kConnectionLost) lane.lost = true;
          lane.room.notify_all();
        },
        std::chrono::seconds(60));
  }
}

size_t TestFlood::acknowledgedCount() const {
  SXMutexLock lock(ackMutex_);
  return acknowledged_.size();
}

std::map<int64_t, TestFlood::Clock::time_point> TestFlood::acknowledged() const {
  SXMutexLock lock(ackMutex_);
  return acknowledged_;
}

std::map<int64_t, size_t> TestFlood::stored(const TestDaemon& daemon, const std::string& db,
                                            const std::string& table) {
  std::map<int64_t, size_t> counts;
  for (const auto& row : daemon.rows(db, "SELECT payload_json FROM " + table)) {
    if (!row["payload_json"].is_string()) continue;
    SXValue payload = SXValue::parse(row["payload_json"].get<std::string>(), nullptr, false);
    if (payload.is_object() && payload["xid"].is_number_integer()) {
      ++counts[payload["xid"].get<int64_t>()];
    }
  }
  return counts;
}
