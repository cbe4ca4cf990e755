#include "support/Daemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <deque>
#include <filesystem>
#include <fstream>
#include <thread>

namespace {

std::vector<char*> pointersTo(std::vector<std::string>& words) {
  std::vector<char*> out;
  for (auto& word : words) out.push_back(word.data());
  out.push_back(nullptr);
  return out;
}

// Starts `words` with the test's environment and `extra` set over it, its output and errors
// to `output`. All is built before the fork: the child of a threaded process may not allocate.
pid_t spawn(std::vector<std::string> words, const std::map<std::string, std::string>& extra,
            const std::string& output) {
  std::vector<std::string> environment;
  for (char** entry = environ; *entry; ++entry) {
    std::string text = *entry;
    if (!extra.count(text.substr(0, text.find('=')))) environment.push_back(std::move(text));
  }
  for (const auto& [name, value] : extra) environment.push_back(name + "=" + value);
  std::vector<char*> argv = pointersTo(words);
  std::vector<char*> envp = pointersTo(environment);
  pid_t pid = ::fork();
  if (pid == 0) {
    int fd = ::open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ::dup2(fd, STDERR_FILENO);
    ::dup2(fd, STDOUT_FILENO);
    ::execve(argv[0], argv.data(), envp.data());
    ::_exit(127);
  }
  return pid;
}

}  // namespace

TestDaemon::TestDaemon() : TestDaemon(Options{}) {}

TestDaemon::TestDaemon(Options options) {
  std::filesystem::create_directories(dir_.file("lib"));
  stateDir_ = options.stateDir.empty() ? dir_.file("lib") : options.stateDir;
  socket_ = dir_.file("run/sxr.sock");
  std::vector<std::string> args = {SXR_DAEMON_PATH, "--socket", socket_, "--state-dir", stateDir_};
  for (const auto& [flag, sub] : {std::pair{"--config-dir", "etc"},
                                  {"--runtime-dir", "run"},
                                  {"--kestrel-root", "kestrel"},
                                  {"--diagnostic-logs-dir", "diag"}}) {
    std::filesystem::create_directories(dir_.file(sub));
    args.insert(args.end(), {flag, dir_.file(sub)});
  }
  if (!options.device.is_null()) writeConfig("device.json", options.device);
  if (!options.fernConfig.is_null()) writeConfig("fernreporting.json", options.fernConfig);
  if (!options.daemonConfig.is_null()) writeConfig("sxreportingd.json", options.daemonConfig);
  for (const auto& [path, value] : options.counters) setCounter(path, value);
  args.insert(args.end(), options.extraArgs.begin(), options.extraArgs.end());
  pid_ = spawn(std::move(args), options.environment, dir_.file("daemon.log"));
  if (options.waitForReady && !waitForLog("ready, listening on")) {
    ADD_FAILURE() << "daemon did not start:\n" << log();
  }
}

void TestDaemon::writeConfig(const std::string& name, const SXValue& value) const {
  std::ofstream(dir_.file("etc/" + name)) << value.dump();
}

void TestDaemon::setCounter(const std::string& channelPath, int64_t value) const {
  std::string path = dir_.file("kestrel/" + channelPath);
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path) << value << "\n";
}

TestDaemon::~TestDaemon() {
  if (!exitStatus_ && pid_ > 0) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }
}

std::unique_ptr<SXReportingClient> TestDaemon::client() const {
  auto client = std::make_unique<SXReportingClient>(
      SXClientOptions{.socketPath = socket_, .defaultTimeout = std::chrono::seconds(10)});
  std::string error;
  if (!client->connect(&error)) ADD_FAILURE() << "connect: " << error;
  return client;
}

std::string TestDaemon::log() const { return SXTestReadFile(dir_.file("daemon.log")); }

static size_t Occurrences(const std::string& text, const std::string& fragment) {
  size_t count = 0;
  for (size_t pos = text.find(fragment); pos != std::string::npos;
       pos = text.find(fragment, pos + fragment.size())) {
    ++count;
  }
  return count;
}

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
  const std::string path = stateDir_ + "/" + db;
  return std::filesystem::exists(path) ? SXTestQuery(path, sql) : std::vector<SXValue>{};
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
  std::string command = std::string(SXR_CTL_PATH) + " --socket " + shellQuoted(socket_) +
                        " --state-dir " + shellQuoted(stateDir_) + " --config-dir " +
                        shellQuoted(dir_.file("etc")) + " --runtime-dir " +
                        shellQuoted(dir_.file("run"));
  for (const auto& word : args) command += " " + shellQuoted(word);
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
  std::vector<std::string> words = {SXR_CTL_PATH, "--socket", socket_};
  words.insert(words.end(), args.begin(), args.end());
  return spawn(std::move(words), {}, "/dev/null");
}

long residentKiB(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
  }
  return -1;
}

TestFlood::TestFlood(std::vector<Sender> senders, size_t window, SXValue payload)
    : window_(window), payload_(std::move(payload)), senders_(std::move(senders)) {
  for (size_t i = 0; i < senders_.size(); ++i) {
    threads_.emplace_back([this, i] { run(senders_[i], static_cast<int64_t>(i) * kIdsPerSender); });
  }
}

void TestFlood::stop() {
  stop_ = true;
  for (auto& thread : threads_) thread.join();
  threads_.clear();
}

void TestFlood::run(const Sender& sender, int64_t firstId) {
  std::deque<std::pair<int64_t, std::future<SXCallResult<std::optional<SXError>>>>> unanswered;
  // Waits for the oldest answer; false once the connection is gone.
  auto settle = [&] {
    auto result = unanswered.front().second.get();
    if (result.replied() && !result.value) {
      SXMutexLock lock(mutex_);
      acknowledged_.insert(unanswered.front().first);
    }
    unanswered.pop_front();
    return result.status != SXCallStatus::kConnectionLost;
  };
  for (int64_t xid = firstId; !stop_; ++xid) {
    if (unanswered.size() >= window_ && !settle()) break;
    SXValue message = payload_;
    message["xid"] = xid;
    unanswered.emplace_back(xid, sender.client->sendMessage(message, 3, 1, sender.reporterIDs,
                                                            std::chrono::seconds(60)));
  }
  while (!unanswered.empty()) settle();
}

size_t TestFlood::acknowledgedCount() const {
  SXMutexLock lock(mutex_);
  return acknowledged_.size();
}

std::set<int64_t> TestFlood::acknowledged() const {
  SXMutexLock lock(mutex_);
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
