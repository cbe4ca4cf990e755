// The summary file's name on internal builds: the host application name comes from a client,
// so it must never name another directory, hide the file or overrun a file name.
#include <gtest/gtest.h>

#include "SXReportingSession.h"
#include "support/TestEnvironment.h"

namespace {

// The part of the file name that the host application name became.
std::string hostPart(const SXValue& host) {
  TestEnvironment t(SXValue{{"InternalBuild", true}});
  auto session = SXReportingSession::initWithID(t.environment, 42, SXValue::array());
  session->setServiceType(7);
  SXValue config = {{"HostApplicationDisplayID", host}};
  session->setConfiguration(&config);
  session->start();
  session->sendMessage({{"a", 1}}, 3, 1, nullptr);
  EXPECT_TRUE(session->createSummaryEventForSession());
  t.drain();
  if (t.fileSystem->files.size() != 1) {
    ADD_FAILURE() << t.fileSystem->files.size() << " files written";
    return "";
  }
  std::string path = t.fileSystem->files.begin()->first;
  EXPECT_EQ(path.rfind("/diag/", 0), 0u) << path;
  EXPECT_EQ(path.find('/', 6), std::string::npos) << path;
  size_t from = path.find("-sonex-") + 7;
  size_t to = path.rfind("-longformaudio.json");
  EXPECT_NE(to, std::string::npos) << path;
  return path.substr(from, to - from);
}

}  // namespace

TEST(SummaryFileName, OrdinaryNamesAreKept) {
  EXPECT_EQ(hostPart("player"), "player");
  EXPECT_EQ(hostPart("com.vendra.Music"), "com.vendra.Music");
  EXPECT_EQ(hostPart("caf\u00e9 app"), "caf\u00e9 app");
}

TEST(SummaryFileName, SeparatorsDotsAndControlCharactersAreReplaced) {
  EXPECT_EQ(hostPart("../../etc/passwd"), "____etc_passwd");
  EXPECT_EQ(hostPart("a/../b"), "a___b");
  EXPECT_EQ(hostPart(".hidden"), "_hidden");
  EXPECT_EQ(hostPart("..."), "_");
  EXPECT_EQ(hostPart("a\\b"), "a_b");
  EXPECT_EQ(hostPart(std::string("nul\0x", 5)), "nul_x");
  EXPECT_EQ(hostPart("tab\there\nnew\x7f"), "tab_here_new_");
}

TEST(SummaryFileName, EmptyAndOverlongNames) {
  EXPECT_EQ(hostPart(""), "unknown");
  EXPECT_EQ(hostPart(std::string(300, 'a')), std::string(64, 'a'));
  // 40 two-byte characters: the cut at 64 bytes keeps 31 of them whole.
  std::string accents;
  for (int i = 0; i < 40; ++i) accents += "\u00e9";
  std::string cut = hostPart(std::string("x") + accents);
  EXPECT_EQ(cut, std::string("x") + accents.substr(0, 62));
  EXPECT_EQ(cut.size(), 63u);
}
