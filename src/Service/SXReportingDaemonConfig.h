// The daemon's own configuration file, `<config-dir>/sxreportingd.json`: an object with one
// object per section, e.g. {"limits": {"max-payload-bytes": 131072}}. It is read at start and
// on every reload (SIGHUP). Each section has its own reader, which takes the whole file and
// looks at its section alone, so that a fault in one section leaves the others in force.
//
// Threads: load() runs on whichever thread starts or reloads the daemon; readers run there.
#pragma once

#include <functional>
#include <memory>
#include <set>
#include <span>
#include <string>
#include <vector>

#include "Statistics/SXReportingEnvironment.h"
#include "platform/Log.h"

class SXReportingConfigFile {
 public:
  // Takes what its section says; false after an error line, when the section keeps what it had.
  using SectionReader = std::function<bool(const SXValue& file)>;

  SXReportingConfigFile(std::string path, std::shared_ptr<SXLogFacility> log);

  const std::string& path() const { return path_; }
  // Adds the reader of one section; it runs at every load from then on.
  void addSection(SectionReader reader) { readers_.push_back(std::move(reader)); }

  // Reads the file and hands it to every reader. An absent file is an empty object. A file
  // that cannot be read or is not a JSON object gets an error line, and every section keeps
  // what it has. Returns false when the file or any section was bad.
  bool load() const;

 private:
  const std::string path_;
  const std::shared_ptr<SXLogFacility> log_;
  std::vector<SectionReader> readers_;
};

// When a changed limit takes effect.
enum class SXLimitApplies { kNextRequest, kNextConnection, kRestart };

// One limit as an option: the long option name without its dashes (also its key in the
// "limits" section), its environment variable, its member and what it limits (for --help).
struct SXReportingLimitOption {
  const char* name;
  const char* environment;
  uint64_t SXReportingLimits::*member;
  SXLimitApplies applies;
  const char* help;
};
std::span<const SXReportingLimitOption> SXReportingLimitOptions();

// The "limits" section: applies the file's values over the limits of the command line and the
// environment, except those named in `fixed` (given there, so they win). Keys are the limits'
// option names, values positive integers. At the first load every limit is taken; at later
// ones, those that apply only at a restart are logged and kept. An unknown key or a bad value
// gets an error line and keeps every limit as it was.
class SXReportingLimitsSection {
 public:
  SXReportingLimitsSection(std::shared_ptr<SXReportingEnvironment> environment,
                           std::set<std::string> fixed);
  bool read(const SXValue& file);

 private:
  // The limits the section gives over `base`; none after an error line.
  std::optional<SXReportingLimits> parse(const SXValue& file, SXReportingLimits base) const;

  const std::shared_ptr<SXReportingEnvironment> environment_;
  const std::set<std::string> fixed_;
  SXReportingLimits flags_;  // the limits before the first file was applied
  bool loaded_ = false;
};
