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

  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override;
  bool isEnabled(const SXLogScope* scope, int level) const override;
  void write(const SXLogScope* scope, SXLogLevel level, std::string_view line) override;

  std::vector<Line> lines() const;
  std::vector<std::string> messages() const;
  // Number of lines whose message equals `message`.
  size_t count(const std::string& message) const;
  // Number of lines whose message contains `fragment`, and whether there is one.
  size_t countContaining(const std::string& fragment) const;
  bool contains(const std::string& fragment) const { return countContaining(fragment) > 0; }
  // Waits until `times` lines have the message `message`; false when `timeout` passes first.
  bool waitFor(const std::string& message, size_t times = 1,
               std::chrono::milliseconds timeout = std::chrono::seconds(20)) const;

 private:
  // Lines whose message is `text` (`whole`) or contains it.
  size_t countLocked(const std::string& text, bool whole) const SX_REQUIRES(mutex_);

  mutable SXMutex mutex_;
  mutable std::condition_variable written_;
  std::set<std::string> verbose_;
  std::vector<Line> lines_;
};
