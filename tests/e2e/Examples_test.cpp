// The example clients in C and Python against the real daemon, and `status --metrics`.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>
#include <filesystem>
#include <regex>
#include <sstream>

#include "support/Daemon.h"

namespace {

struct Outcome {
  int status = -1;
  std::string out;  // stdout and stderr together
};

Outcome run(const std::string& command) {
  Outcome result;
  FILE* pipe = ::popen((command + " 2>&1").c_str(), "r");
  if (!pipe) return result;
  char buf[4096];
  size_t n;
  while ((n = std::fread(buf, 1, sizeof buf, pipe)) > 0) result.out.append(buf, n);
  const int raw = ::pclose(pipe);
  result.status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
  return result;
}

std::string quoted(const std::string& word) { return "'" + word + "'"; }

// Both examples walk one session through the same steps and print the same replies.
std::string expectedWalk(const std::string& yes, int64_t id) {
  const std::string n = std::to_string(id);
  return "create: " + yes + "\nset-type: " + yes + "\nconfigure: " + yes +
         "\nsend: delivered\nvalid: reporterID " + n + ", serviceType 2\nlist: " + n +
         "\ndestroy: " + yes + "\n";
}

TEST(ExamplesEndToEnd, TheCExampleWalksASessionThroughItsLife) {
  TestDaemon daemon;
  Outcome walk = run(quoted(SXR_C_EXAMPLE_PATH) + " " + quoted(daemon.socket()) + " 42");
  EXPECT_EQ(walk.status, 0) << walk.out;
  EXPECT_EQ(walk.out, expectedWalk("true", 42));

  Outcome absent = run(quoted(SXR_C_EXAMPLE_PATH) + " " + quoted(daemon.dir("no-such-socket")));
  EXPECT_EQ(absent.status, 2);
  EXPECT_NE(absent.out.find("no-such-socket"), std::string::npos) << absent.out;
}

TEST(ExamplesEndToEnd, ThePythonExampleWalksASessionThroughItsLife) {
  if (!std::filesystem::exists("/usr/bin/python3")) GTEST_SKIP() << "no /usr/bin/python3";
  TestDaemon daemon;
  const std::string script = "/usr/bin/python3 " + quoted(SXR_PYTHON_EXAMPLE_PATH);
  Outcome walk = run(script + " --socket " + quoted(daemon.socket()) + " --reporter-id -7");
  EXPECT_EQ(walk.status, 0) << walk.out;
  EXPECT_EQ(walk.out, expectedWalk("True", -7));

  // The sessions of a run end with its connection.
  auto client = daemon.client();
  EXPECT_TRUE(waitUntil([&] { return replied(client->getAllReporters()).empty(); }));

  Outcome absent = run(script + " --socket " + quoted(daemon.dir("no-such-socket")));
  EXPECT_EQ(absent.status, 1);
  EXPECT_NE(absent.out.find("sxreporting_client: "), std::string::npos) << absent.out;
}

TEST(ExamplesEndToEnd, StatusMetricsIsPrometheusText) {
  TestDaemon daemon;
  auto client = daemon.client();  // one more client for the status to show
  std::string text;
  ASSERT_EQ(daemon.ctl({"status", "--metrics"}, &text), 0) << text;
  EXPECT_TRUE(text.starts_with("# HELP sxreporting_up ")) << text;
  EXPECT_NE(text.find("\nsxreporting_up 1\n"), std::string::npos) << text;
  EXPECT_NE(text.find("\nsxreporting_reporting_enabled 1\n"), std::string::npos) << text;
  const std::regex line(
      R"(# (HELP|TYPE) sxreporting_[a-z0-9_]+ .*|sxreporting_[a-z0-9_]+(\{[a-z]+="[^"]*"\})? [-+.0-9eNaInf]+)");
  std::istringstream lines(text);
  for (std::string one; std::getline(lines, one);) {
    EXPECT_TRUE(std::regex_match(one, line)) << one;
  }
  EXPECT_EQ(text.back(), '\n');
}

}  // namespace
