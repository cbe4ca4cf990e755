// Production log facility. Where lines go is chosen once, at construction:
//   kJournal   the journal's native protocol, when the journal is attached to stderr
//              (JOURNAL_STREAM names stderr's device and inode): MESSAGE, PRIORITY,
//              SYSLOG_IDENTIFIER=sxreportingd and, for a scoped line, SXR_SCOPE,
//              SXR_SUBSYSTEM and SXR_CATEGORY, so that `journalctl SXR_SCOPE=sxrr` filters;
//   kPrefixed  stderr lines prefixed with their syslog priority ("<5>" default, "<6>" info,
//              "<3>" error, "<7>" debug), for a pipe or a file read by a log collector;
//   kPlain     bare stderr lines, for a person at a terminal.
// A line the journal refuses goes to stderr, prefixed.
#pragma once

#include <map>
#include <mutex>

#include "platform/Log.h"

class SXStderrLog final : public SXLogFacility {
 public:
  enum class Output { kJournal, kPrefixed, kPlain };

  // `levels`: "sxrs=5,sxrr=5" names the level at which each scope is enabled. Scopes not
  // named are enabled up to level 0 (verbose lines off).
  explicit SXStderrLog(std::string_view levels, Output output = outputFor(2));

  std::shared_ptr<const SXLogScope> registerScope(const SXLogScope& scope) override;
  bool isEnabled(const SXLogScope* scope, int level) const override;
  void write(const SXLogScope* scope, SXLogLevel level, std::string_view line) override;

  // Parses "name=level,..."; returns false on a malformed entry.
  static bool parseLevels(std::string_view text, std::map<std::string, int>& out);
  // The output that suits descriptor `fd` as stderr, given the environment's JOURNAL_STREAM.
  static Output outputFor(int fd);

 private:
  bool writeToJournal(const SXLogScope* scope, int priority, std::string_view line);

  std::map<std::string, int> levels_;  // immutable after construction
  const Output output_;
  std::mutex writeMutex_;
};
