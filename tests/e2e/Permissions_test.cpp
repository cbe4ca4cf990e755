// What other local users can reach: the modes of the directories, stores and socket the daemon
// creates, and symlinks planted where it writes summary files.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <ctime>
#include <filesystem>
#include <fstream>

#include "support/Daemon.h"

namespace {

namespace fs = std::filesystem;

// The permission bits of `path`, or -1 when it is not there.
int modeOf(const std::string& path) {
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) return -1;
  return static_cast<int>(st.st_mode & 07777);
}

// The summary files in `dir` that are regular files, not symlinks (nor temporary files).
std::vector<fs::path> summaryFiles(const std::string& dir) {
  std::vector<fs::path> files;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(dir, ec)) {
    if (entry.path().extension() == ".json" && entry.is_regular_file() && !entry.is_symlink()) {
      files.push_back(entry.path());
    }
  }
  return files;
}

// One long-form-audio session of "player" from start to stop, which writes a summary file on
// an internal build.
void runSession(SXReportingClient& client, int64_t id) {
  ASSERT_TRUE(replied(client.createReportingSession(id)));
  ASSERT_TRUE(replied(client.setServiceType(7, id)));
  ASSERT_TRUE(
      replied(client.setConfiguration(SXValue{{"HostApplicationDisplayID", "player"}}, id)));
  auto start = client.startReportingSessionForID(id, kSXWaitForever);
  EXPECT_FALSE(replied(client.sendMessage({{"k", id}}, 3, 1, std::vector<int64_t>{id})));
  EXPECT_TRUE(replied(client.stopReportingSessionForID(id)));
  EXPECT_TRUE(start.get().value);
}

// The summary file names the session above gets in each second from a little before now to
// well after, in the daemon's time zone.
std::vector<std::string> summaryNamesAroundNow() {
  std::vector<std::string> names;
  std::time_t now = std::time(nullptr);
  for (std::time_t t = now - 2; t <= now + 120; ++t) {
    std::tm local{};
    localtime_r(&t, &local);
    char stamp[32];
    std::strftime(stamp, sizeof stamp, "%Y%m%d-%H%M%S%z", &local);
    names.push_back(std::string(stamp) + "-sonex-player-longformaudio.json");
  }
  return names;
}

}  // namespace

TEST(PermissionsEndToEnd, DirectoriesStoresAndSocketTheDaemonCreatesAreClosedToOthers) {
  // The default mode, one narrower than the daemon's umask allows and one wider (the umask
  // cannot give it).
  for (const char* mode : {"", "0600", "0666"}) {
    SCOPED_TRACE(mode);
    SXTestTempDir fresh;
    TestDaemon::Options options{.extraArgs = {"--state-dir", fresh.file("new/lib"), "--config-dir",
                                              fresh.file("new/etc"), "--runtime-dir",
                                              fresh.file("new/run")}};
    if (*mode) options.extraArgs.insert(options.extraArgs.end(), {"--socket-mode", mode});
    TestDaemon daemon(options);
    auto client = daemon.client();
    ASSERT_TRUE(replied(client->createReportingSession(1)));
    for (const char* dir : {"new", "new/lib", "new/etc", "new/run", "new/run/notify"}) {
      EXPECT_EQ(modeOf(fresh.file(dir)), 0750) << dir;
    }
    for (const char* store : {"tallyvane.db", "joulebook.db", "fernreporting.db"}) {
      EXPECT_EQ(modeOf(fresh.file("new/lib/") + store), 0640) << store;
      EXPECT_EQ(modeOf(fresh.file("new/lib/") + store + "-wal"), 0640) << store;
    }
    EXPECT_EQ(modeOf(daemon.socket()), *mode ? std::stoi(mode, nullptr, 8) : 0660);
  }
}

TEST(PermissionsEndToEnd, SummaryFilesStayInTheirOwnClosedDirectory) {
  SXTestTempDir outside;
  std::string victim = outside.file("victim");
  std::ofstream(victim) << "keep";
  ASSERT_EQ(::chmod(victim.c_str(), 0600), 0);
  std::string elsewhere = outside.file("elsewhere");
  fs::create_directory(elsewhere);
  std::string diag = outside.file("logs/Reporting");
  TestDaemon daemon(
      {.extraArgs = {"--diagnostic-logs-dir", diag}, .device = {{"InternalBuild", true}}});
  auto client = daemon.client();

  // The summary code asks for 0777; the daemon's umask takes the directory and the parent it
  // creates to 0750.
  runSession(*client, 1);
  ASSERT_TRUE(waitUntil([&] { return !summaryFiles(diag).empty(); })) << daemon.log();
  EXPECT_EQ(modeOf(outside.file("logs")), 0750);
  EXPECT_EQ(modeOf(diag), 0750);
  EXPECT_EQ(modeOf(summaryFiles(diag)[0]), 0640);
  fs::rename(diag, outside.file("logs/first"));
  fs::create_directory(diag);

  // Symlinks to the victim at every name the next summary may get, and at the temporary name
  // an earlier version derived from it and the pid.
  std::vector<std::string> planted = summaryNamesAroundNow();
  for (const auto& name : planted) {
    fs::create_symlink(victim, diag + "/" + name);
    fs::create_symlink(victim, diag + "/" + name + ".tmp." + std::to_string(daemon.pid()));
  }
  runSession(*client, 2);
  ASSERT_TRUE(waitUntil([&] { return !summaryFiles(diag).empty(); })) << daemon.log();
  auto files = summaryFiles(diag);
  ASSERT_EQ(files.size(), 1u);
  // The symlink at its name is left alone, not written through: the file takes the next name.
  std::string name = files[0].filename().string();
  ASSERT_GT(name.size(), 7u);
  EXPECT_EQ(name.substr(name.size() - 7), "-2.json") << name;
  std::string plain = name.substr(0, name.size() - 7) + ".json";
  EXPECT_NE(std::find(planted.begin(), planted.end(), plain), planted.end()) << files[0];
  EXPECT_EQ(SXValue::parse(SXTestReadFile(files[0].string()))[0],
            (SXValue{{"HostApplicationDisplayID", "player"}}));
  EXPECT_EQ(SXTestReadFile(victim), "keep");
  EXPECT_EQ(modeOf(victim), 0600);

  // The directory swapped for a symlink to another one: the summary is refused, not written
  // there.
  fs::rename(diag, outside.file("logs/second"));
  fs::create_directory_symlink(elsewhere, diag);
  runSession(*client, 3);
  EXPECT_TRUE(daemon.waitForLog("jsonOutput writeToURL: " + diag + ": is a symbolic link"))
      << daemon.log();
  EXPECT_TRUE(fs::is_empty(elsewhere));
  EXPECT_EQ(daemon.countInLog("can't create logging directory"), 0u);

  // A regular file where a parent directory should be: the summary file is lost, with its
  // reason, and the summary event still reaches the spool.
  fs::rename(outside.file("logs"), outside.file("old-logs"));
  std::ofstream(outside.file("logs")) << "x";
  runSession(*client, 4);
  EXPECT_TRUE(daemon.waitForLog(
      "-[SXReportingSession createSummaryEventForSession]: can't create logging directory at " +
      diag + ": "));
  EXPECT_EQ(
      daemon.waitForRows("fernreporting.db", "SELECT id FROM messages WHERE category = 65535", 4)
          .size(),
      4u);
}
