// Where the production log writes: the journal when it is attached to stderr, priority-prefixed
// lines for pipes and files, bare lines on a terminal. (The prefixed lines themselves are read
// through the daemon: e2e/Registry, e2e/CrashSafety.)
#include "linux/StderrLog.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

namespace {

using Output = SXStderrLog::Output;

std::string deviceAndInode(int fd) {
  struct stat st {};
  ::fstat(fd, &st);
  return std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino);
}

}  // namespace

TEST(StderrLog, OutputSuitsWhatStderrIs) {
  int pipeFds[2];
  ASSERT_EQ(::pipe(pipeFds), 0);
  int terminal = ::posix_openpt(O_RDWR | O_NOCTTY);
  ASSERT_GE(terminal, 0);
  ASSERT_EQ(::grantpt(terminal), 0);
  ASSERT_EQ(::unlockpt(terminal), 0);
  int follower = ::open(::ptsname(terminal), O_RDWR | O_NOCTTY);
  ASSERT_GE(follower, 0);

  struct Case {
    const char* what;
    int fd;
    std::string journalStream;  // empty: unset
    Output expected;
  } cases[] = {
      {"a pipe", pipeFds[1], "", Output::kPrefixed},
      {"a terminal", follower, "", Output::kPlain},
      {"the journal's stream", pipeFds[1], deviceAndInode(pipeFds[1]), Output::kJournal},
      {"another stream than the journal's", follower, deviceAndInode(pipeFds[1]), Output::kPlain},
      {"a malformed JOURNAL_STREAM", pipeFds[1], "journal", Output::kPrefixed},
  };
  for (const Case& c : cases) {
    if (c.journalStream.empty()) {
      ::unsetenv("JOURNAL_STREAM");
    } else {
      ::setenv("JOURNAL_STREAM", c.journalStream.c_str(), 1);
    }
    EXPECT_EQ(SXStderrLog::outputFor(c.fd), c.expected) << c.what;
  }
  ::unsetenv("JOURNAL_STREAM");
  for (int fd : {pipeFds[0], pipeFds[1], terminal, follower}) ::close(fd);
}
