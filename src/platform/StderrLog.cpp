#include "platform/StderrLog.h"

#include <charconv>
#include <cstdio>

SXStderrLog::SXStderrLog(std::string_view levels) { parseLevels(levels, levels_); }

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

void SXStderrLog::write(const SXLogScope*, SXLogLevel level, std::string_view line) {
  const char* priority = "<5>";
  switch (level) {
    case SXLogLevel::kDefault:
      priority = "<5>";
      break;
    case SXLogLevel::kInfo:
      priority = "<6>";
      break;
    case SXLogLevel::kError:
      priority = "<3>";
      break;
    case SXLogLevel::kDebug:
      priority = "<7>";
      break;
  }
  std::lock_guard lock(writeMutex_);
  std::fputs(priority, stderr);
  std::fwrite(line.data(), 1, line.size(), stderr);
  std::fputc('\n', stderr);
  std::fflush(stderr);
}
