// Records every line written, with its level and scope. Scopes named in `verboseScopes` are
// enabled at the verbose level.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "common/SXThreadSafety.h"
#include "platform/Log.h"

class FakeLog final : public SXLogFacility {
 public:
  struct Line {
    std::string scope;  // short name; "" for the default log
    SXLogLevel level;
    std::string text;     // the whole line, prefix included
    std::string message;  // the part after "file:line:function: "
  };

  explicit FakeLog(std::set<std::string> verboseScopes = {}) : verbose_(std::move(verboseScopes)) {}

  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override {
    return std::make_shared<const SXLogScope>(scope);
  }
  bool isEnabled(const SXLogScope* scope, int level) const override {
    SXMutexLock lock(mutex_);
    return scope && level <= kSXLogVerboseLevel && verbose_.count(scope->shortName);
  }
  void write(const SXLogScope* scope, SXLogLevel level, std::string_view line) override {
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

  std::vector<Line> lines() const {
    SXMutexLock lock(mutex_);
    return lines_;
  }
  std::vector<std::string> messages() const {
    std::vector<std::string> out;
    for (const auto& l : lines()) out.push_back(l.message);
    return out;
  }
  // Number of lines whose message equals `message`.
  size_t count(const std::string& message) const {
    SXMutexLock lock(mutex_);
    return countLocked(message, true);
  }
  // Number of lines whose message contains `fragment`, and whether there is one.
  size_t countContaining(const std::string& fragment) const {
    SXMutexLock lock(mutex_);
    return countLocked(fragment, false);
  }
  bool contains(const std::string& fragment) const { return countContaining(fragment) > 0; }
  // Waits until `times` lines have the message `message`; false when `timeout` passes first.
  bool waitFor(const std::string& message, size_t times = 1,
               std::chrono::milliseconds timeout = std::chrono::seconds(20)) const {
    SXMutexLock lock(mutex_);
    return lock.waitFor(written_, timeout,
                        [&]() SX_REQUIRES(mutex_) { return countLocked(message, true) >= times; });
  }

 private:
  // Lines whose message is `text` (`whole`) or contains it.
  size_t countLocked(const std::string& text, bool whole) const SX_REQUIRES(mutex_) {
    size_t n = 0;
    for (const auto& l : lines_) {
      n += whole ? l.message == text : l.message.find(text) != std::string::npos;
    }
    return n;
  }

  mutable SXMutex mutex_;
  mutable std::condition_variable written_;
  std::set<std::string> verbose_;
  std::vector<Line> lines_;
};
