// What other local users can reach: the modes of the directories, stores and socket the daemon
// creates.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include "support/Daemon.h"

namespace {

// The permission bits of `path`, or -1 when it is not there.
int modeOf(const std::string& path) {
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) return -1;
  return static_cast<int>(st.st_mode & 07777);
}

}  // namespace

TEST(PermissionsEndToEnd, DirectoriesAndStoresTheDaemonCreatesAreClosedToOthers) {
  SXTestTempDir fresh;
  TestDaemon::Options options;
  options.extraArgs = {"--state-dir",         fresh.file("new/lib"), "--config-dir",
                       fresh.file("new/etc"), "--runtime-dir",       fresh.file("new/run")};
  TestDaemon daemon(options);
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(1)));

  EXPECT_EQ(modeOf(fresh.file("new")), 0750);
  for (const char* dir : {"new/lib", "new/etc", "new/run"}) {
    EXPECT_EQ(modeOf(fresh.file(dir)), 0750) << dir;
  }
  for (const char* store : {"tallyvane.db", "joulebook.db", "fernreporting.db"}) {
    EXPECT_EQ(modeOf(fresh.file("new/lib/") + store), 0640) << store;
    EXPECT_EQ(modeOf(fresh.file("new/lib/") + store + "-wal"), 0640) << store;
  }
  EXPECT_EQ(modeOf(daemon.socket()), 0660);
}

TEST(PermissionsEndToEnd, TheSocketGetsExactlyTheConfiguredMode) {
  // One mode narrower than the daemon's umask allows, one wider (the umask cannot give it).
  for (int mode : {0600, 0666}) {
    char text[8];
    std::snprintf(text, sizeof text, "%04o", static_cast<unsigned>(mode));
    TestDaemon::Options options;
    options.extraArgs = {"--socket-mode", text};
    TestDaemon daemon(options);
    EXPECT_EQ(modeOf(daemon.socket()), mode) << text;
    auto client = daemon.client();
    EXPECT_TRUE(replied(client->createReportingSession(1))) << text;
  }
}
