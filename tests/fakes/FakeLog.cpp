#include "fakes/FakeLog.h"

std::shared_ptr<const SXLogScope> FakeLog::registerScope(const SXLogScope& scope) {
  return std::make_shared<const SXLogScope>(scope);
}

bool FakeLog::isEnabled(const SXLogScope* scope, int level) const {
  SXMutexLock lock(mutex_);
  return scope && level <= kSXLogVerboseLevel && verbose_.count(scope->shortName);
}

void FakeLog::write(const SXLogScope* scope, SXLogLevel level, std::string_view line) {
  std::string text(line);
  // The prefix is "file:line:function: "; the function may itself hold ": " (none of ours do).
  size_t first = text.find(':');
  size_t second = first == std::string::npos ? first : text.find(':', first + 1);
  size_t third = second == std::string::npos ? second : text.find(": ", second + 1);
  std::string message = third == std::string::npos ? text : text.substr(third + 2);
  {
    SXMutexLock lock(mutex_);
    lines_.push_back({scope ? scope->shortName : "", level, std::move(text), std::move(message)});
  }
  written_.notify_all();
}

std::vector<FakeLog::Line> FakeLog::lines() const {
  SXMutexLock lock(mutex_);
  return lines_;
}

std::vector<std::string> FakeLog::messages() const {
  std::vector<std::string> out;
  for (const auto& l : lines()) out.push_back(l.message);
  return out;
}

size_t FakeLog::countLocked(const std::string& text, bool whole) const {
  size_t n = 0;
  for (const auto& l : lines_) {
    n += whole ? l.message == text : l.message.find(text) != std::string::npos;
  }
  return n;
}

size_t FakeLog::count(const std::string& message) const {
  SXMutexLock lock(mutex_);
  return countLocked(message, true);
}

size_t FakeLog::countContaining(const std::string& fragment) const {
  SXMutexLock lock(mutex_);
  return countLocked(fragment, false);
}

bool FakeLog::waitFor(const std::string& message, size_t times,
                      std::chrono::milliseconds timeout) const {
  SXMutexLock lock(mutex_);
  return lock.waitFor(written_, timeout,
                      [&]() SX_REQUIRES(mutex_) { return countLocked(message, true) >= times; });
}
