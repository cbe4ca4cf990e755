// Production log facility: one line per write on stderr, prefixed with its syslog priority
// ("<5>" default, "<6>" info, "<3>" error, "<7>" debug) so that journald keeps the level.
#pragma once

#include <map>
#include <mutex>

#include "platform/Log.h"

class SXStderrLog final : public SXLogFacility {
 public:
  // `levels`: "sxrs=5,sxrr=5" names the level at which each scope is enabled. Scopes not
  // named are enabled up to level 0 (verbose lines off).
  explicit SXStderrLog(std::string_view levels);

  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override;
  bool isEnabled(const SXLogScope* scope, int level) const override;
  void write(const SXLogScope* scope, SXLogLevel level, std::string_view line) override;

  // Parses "name=level,..."; returns false on a malformed entry.
  static bool parseLevels(std::string_view text, std::map<std::string, int>& out);

 private:
  std::map<std::string, int> levels_;  // immutable after construction
  std::mutex writeMutex_;
};
