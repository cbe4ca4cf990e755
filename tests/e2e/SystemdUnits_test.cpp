// The packaged systemd units as systemd reads them, with ExecStart pointing at the build's
// daemon: systemd-analyze verify finds nothing to say, and the daemon accepts the unit's
// command line.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <regex>

#include "support/Daemon.h"

namespace fs = std::filesystem;

TEST(SystemdUnitsTest, VerifyFindsNothingAndTheDaemonAcceptsTheUnitsCommandLine) {
  SXTestTempDir dir;
  const fs::path units = fs::path(SXR_SOURCE_DIR) / "packaging/systemd";
  const std::string service = std::regex_replace(SXTestReadFile(units / "sxreportingd.service.in"),
                                                 std::regex("@SXR_SBINDIR@"),
                                                 fs::path(SXR_DAEMON_PATH).parent_path().string());
  ASSERT_FALSE(std::regex_search(service, std::regex("@[A-Z_]+@"))) << "a variable is left";
  std::ofstream(dir.file("sxreportingd.service")) << service;
  fs::copy_file(units / "sxreportingd.socket", dir.file("sxreportingd.socket"));

  // ExecStart with its continuation lines joined; --version last makes the daemon read every
  // flag before it and stop there, touching no directory.
  const std::string joined = std::regex_replace(service, std::regex("\\\\\n"), " ");
  std::smatch line;
  ASSERT_TRUE(std::regex_search(joined, line, std::regex("\nExecStart=([^\n]*)")));
  CommandRun daemon = runCommand(line[1].str() + " --version 2>&1");
  EXPECT_EQ(daemon.status, 0) << daemon.output;
  EXPECT_TRUE(std::regex_match(daemon.output, std::regex("sxreportingd [0-9.]+\n")))
      << daemon.output;

  if (runCommand("command -v systemd-analyze").status != 0) GTEST_SKIP() << "no systemd-analyze";
  CommandRun verify = runCommand("cd " + shellQuoted(dir.path()) +
                                 " && systemd-analyze verify --man=no ./sxreportingd.socket "
                                 "./sxreportingd.service 2>&1");
  EXPECT_EQ(verify.status, 0) << verify.output;
  EXPECT_EQ(verify.output, "");
}
