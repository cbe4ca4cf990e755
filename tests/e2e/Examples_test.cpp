// The example clients in C and Python against the real daemon.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>
#include <filesystem>

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

std::string quoted(const std::string& word) {
  std::string text = "'";
  for (char c : word) text += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return text + "'";
}

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
  const std::string script = "/usr/bin/python3 -B " + quoted(SXR_PYTHON_EXAMPLE_PATH);
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

TEST(ExamplesEndToEnd, ThePythonClientSurvivesSilenceAndRejections) {
  if (!std::filesystem::exists("/usr/bin/python3")) GTEST_SKIP() << "no /usr/bin/python3";
  TestDaemon daemon;
  const std::string dir = std::filesystem::path(SXR_PYTHON_EXAMPLE_PATH).parent_path();
  // stop(0) never replies; the reply of a start that timed out comes later and must not be
  // taken for the reply of another call.
  const std::string program =
      "import sys; sys.path.insert(0, sys.argv[1]); import sxreporting_client as s\n"
      "c = s.SXReportingClient(sys.argv[2])\n"
      "for call in (lambda: c.stop_reporting_session_for_id(0, timeout=0.2),\n"
      "             lambda: c.call('frobnicate:', [])):\n"
      "    try: call()\n"
      "    except s.SXReportingError as e: print(type(e).__name__, e)\n"
      "print(c.create_reporting_session(5))\n"
      "try: c.start_reporting_session_for_id(5, timeout=0.2)\n"
      "except s.SXReportingTimeout: print('held')\n"
      "print(s.SXReportingClient(sys.argv[2]).stop_reporting_session_for_id(5))\n"
      "print(c.reporter_id_valid(5), c.get_all_reporters())\n";
  Outcome outcome = run("/usr/bin/python3 -B -c " + quoted(program) + " " + quoted(dir) + " " +
                        quoted(daemon.socket()));
  EXPECT_EQ(outcome.status, 0) << outcome.out;
  EXPECT_EQ(outcome.out,
            "SXReportingTimeout no reply within 0.2 s\n"
            "SXReportingError frobnicate:: unknown method 'frobnicate:'\n"
            "True\nheld\nTrue\n"
            "{'reporterID': 5, 'serviceType': 65535} [5]\n");
}

}  // namespace
