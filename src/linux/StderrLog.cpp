#include "linux/StderrLog.h"

#include <pthread.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace {

int SyslogPriority(SXLogLevel level) {
  switch (level) {
    case SXLogLevel::kInfo:
      return 6;
    case SXLogLevel::kError:
      return 3;
    case SXLogLevel::kDebug:
      return 7;
    case SXLogLevel::kDefault:
      break;
  }
  return 5;
}

// Whether JOURNAL_STREAM ("<device>:<inode>") names the file open on `fd`.
bool JournalAttached(int fd) {
  const char* stream = std::getenv("JOURNAL_STREAM");
  struct stat st {};
  if (!stream || ::fstat(fd, &st) != 0) return false;
  unsigned long long device = 0, inode = 0;
  return std::sscanf(stream, "%llu:%llu", &device, &inode) == 2 && device == st.st_dev &&
         inode == st.st_ino;
}

// A short write or an interrupted one is resumed; a failing stderr loses the rest.
void WriteAll(int fd, std::string_view text) {
  while (!text.empty()) {
    ssize_t n = ::write(fd, text.data(), text.size());
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    text.remove_prefix(static_cast<size_t>(n));
  }
}

}  // namespace

SXStderrLog::SXStderrLog(std::string_view levels, Output output) : output_(output) {
  parseLevels(levels, levels_);
}

SXStderrLog::~SXStderrLog() {
  std::thread writer;
  {
    SXMutexLock lock(mutex_);
    stopping_ = true;
    writer.swap(writer_);
  }
  wake_.notify_one();
  if (writer.joinable()) writer.join();
}

SXStderrLog::Output SXStderrLog::outputFor(int fd) {
  if (JournalAttached(fd)) return Output::kJournal;
  return ::isatty(fd) ? Output::kPlain : Output::kPrefixed;
}

bool SXStderrLog::parseLevels(std::string_view text, std::map<std::string, int>& out) {
  bool ok = true;
  while (!text.empty()) {
    size_t comma = text.find(',');
    std::string_view item = text.substr(0, comma);
    text = comma == std::string_view::npos ? std::string_view() : text.substr(comma + 1);
    if (item.empty()) continue;
    size_t eq = item.find('=');
    int level = kSXLogVerboseLevel;
    if (eq != std::string_view::npos) {
      std::string_view number = item.substr(eq + 1);
      auto [p, ec] = std::from_chars(number.data(), number.data() + number.size(), level);
      if (ec != std::errc() || p != number.data() + number.size()) {
        ok = false;
        continue;
      }
    }
    out[std::string(item.substr(0, eq))] = level;
  }
  return ok;
}

std::shared_ptr<const SXLogScope> SXStderrLog::registerScope(const SXLogScope& scope) {
  return std::make_shared<const SXLogScope>(scope);
}

bool SXStderrLog::isEnabled(const SXLogScope* scope, int level) const {
  if (!scope || !scope->enabled) return false;
  auto it = levels_.find(scope->shortName);
  return it != levels_.end() && level <= it->second;
}

bool SXStderrLog::writeToJournal(const SXLogScope* scope, int priority, std::string_view line) {
  std::vector<std::string> fields = {"MESSAGE=" + std::string(line),
                                     "PRIORITY=" + std::to_string(priority),
                                     "SYSLOG_IDENTIFIER=sxreportingd"};
  if (scope) {
    fields.push_back("SXR_SCOPE=" + scope->shortName);
    fields.push_back("SXR_SUBSYSTEM=" + scope->subsystem);
    fields.push_back("SXR_CATEGORY=" + scope->category);
  }
  std::vector<iovec> vector;
  for (auto& field : fields) vector.push_back({field.data(), field.size()});
  return sd_journal_sendv(vector.data(), static_cast<int>(vector.size())) >= 0;
}

void SXStderrLog::write(const SXLogScope* scope, SXLogLevel level, std::string_view line) {
  int priority = SyslogPriority(level);
  if (output_ == Output::kJournal && writeToJournal(scope, priority, line)) return;
  char prefix[8] = "";
  if (output_ != Output::kPlain) std::snprintf(prefix, sizeof prefix, "<%d>", priority);
  size_t size = std::strlen(prefix) + line.size() + 1;
  SXMutexLock lock(mutex_);
  lock.wait(written_, [this]() SX_REQUIRES(mutex_) {
    return waiting_.size() < kMaxWaitingBytes || stopping_;
  });
  if (stopping_) {  // the writer is gone or going: write it ourselves, after what it had
    lock.unlock();
    WriteAll(STDERR_FILENO, (prefix + std::string(line)) += '\n');
    return;
  }
  bool first = waiting_.empty();
  bool filled = waiting_.size() < kBatchBytes && waiting_.size() + size >= kBatchBytes;
  ((waiting_ += prefix) += line) += '\n';
  ++linesQueued_;
  if (!writer_.joinable()) {
    writer_ = std::thread([this] {
      pthread_setname_np(pthread_self(), "sxr-log");
      writeWaiting();
    });
  }
  if (first || filled) wake_.notify_one();
}

void SXStderrLog::writeWaiting() {
  SXMutexLock lock(mutex_);
  for (;;) {
    lock.wait(wake_, [this]() SX_REQUIRES(mutex_) { return stopping_ || !waiting_.empty(); });
    if (waiting_.empty()) return;  // stopping, and everything is out
    // A line seldom comes alone: waiting a moment for the rest of a burst saves a wake-up
    // and a write per line.
    lock.waitFor(wake_, kLinger, [this]() SX_REQUIRES(mutex_) {
      return stopping_ || flushWaiters_ > 0 || waiting_.size() >= kBatchBytes;
    });
    std::string batch;
    batch.swap(waiting_);
    uint64_t lines = linesQueued_;
    lock.unlock();
    WriteAll(STDERR_FILENO, batch);
    lock.lock();
    linesWritten_ = lines;
    written_.notify_all();
  }
}

void SXStderrLog::flush() {
  SXMutexLock lock(mutex_);
  uint64_t target = linesQueued_;
  ++flushWaiters_;
  wake_.notify_one();  // no lingering for lines someone waits for
  lock.wait(written_,
            [&]() SX_REQUIRES(mutex_) { return linesWritten_ >= target || !writer_.joinable(); });
  --flushWaiters_;
}
