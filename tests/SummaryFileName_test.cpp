// The summary file's name on internal builds: the host application name comes from a client
// and stands in the name as it is, but it must never name another directory or overrun a name.
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

TEST(SummaryFileName, NamesAreKeptButForSlashAndNul) {
  for (const std::string name : {"player", "com.vendra.Music", "caf\u00e9 app", "", ".hidden", "...",
                                 "a\\b", "tab\there\nnew\x7f"}) {
    EXPECT_EQ(hostPart(name), name);
  }
  EXPECT_EQ(hostPart("../../etc/passwd"), ".._.._etc_passwd");
  EXPECT_EQ(hostPart(std::string("nul\0x", 5)), "nul_x");
}

TEST(SummaryFileName, OnlyANameTooLongForTheFileSystemIsCut) {
  // "20261116-185803+0000-sonex-" and "-longformaudio.json": 46 bytes besides the host.
  EXPECT_EQ(hostPart(std::string(209, 'a')), std::string(209, 'a'));
  EXPECT_EQ(hostPart(std::string(300, 'a')), std::string(209, 'a'));
  // Two-byte characters: the cut keeps 104 of them whole rather than split the 105th.
  std::string accents;
  for (int i = 0; i < 120; ++i) accents += "\u00e9";
  EXPECT_EQ(hostPart(accents), accents.substr(0, 208));
}

TEST(SummaryFileName, SessionsStoppingInTheSameSecondKeepTheirOwnFiles) {
  TestEnvironment t(SXValue{{"InternalBuild", true}});
  SXValue config = {{"HostApplicationDisplayID", "player"}};
  for (int64_t id : {1, 2, 3}) {
    auto session = SXReportingSession::initWithID(t.environment, id, SXValue::array());
    session->setServiceType(7);
    session->setConfiguration(&config);
    session->start();
    session->sendMessage({{"n", id}}, 3, 1, nullptr);
    EXPECT_TRUE(session->createSummaryEventForSession());
  }
  t.drain();
  std::vector<std::string> names;
  for (const auto& [path, contents] : t.fileSystem->files) {
    names.push_back(path.substr(path.rfind("-sonex-")));
  }
  EXPECT_EQ(names, (std::vector<std::string>{"-sonex-player-longformaudio-2.json",
                                             "-sonex-player-longformaudio-3.json",
                                             "-sonex-player-longformaudio.json"}));
}
