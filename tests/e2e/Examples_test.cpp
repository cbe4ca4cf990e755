// The example clients in C and Python against the real daemon.
#include <gtest/gtest.h>

#include <filesystem>

#include "support/Daemon.h"

namespace {

CommandRun run(const std::string& command) { return runCommand(command + " 2>&1"); }

// Both examples walk one session through the same steps and print the same replies.
std::string expectedWalk(const std::string& yes, int64_t id) {
  const std::string n = std::to_string(id);
  return "create: " + yes + "\nset-type: " + yes + "\nconfigure: " + yes +
         "\nsend: delivered\nvalid: reporterID " + n + ", serviceType 2\nlist: " + n +
         "\ndestroy: " + yes + "\n";
}

TEST(ExamplesEndToEnd, TheCAndPythonExamplesWalkASessionThroughItsLife) {
  TestDaemon daemon;
  const std::string c = shellQuoted(SXR_C_EXAMPLE_PATH) + " ";
  CommandRun walk = run(c + shellQuoted(daemon.socket()) + " 42");
  EXPECT_EQ(walk.status, 0) << walk.output;
  EXPECT_EQ(walk.output, expectedWalk("true", 42));
  CommandRun absent = run(c + shellQuoted(daemon.dir("no-such-socket")));
  EXPECT_EQ(absent.status, 2);
  EXPECT_NE(absent.output.find("no-such-socket"), std::string::npos) << absent.output;

  if (!std::filesystem::exists("/usr/bin/python3")) GTEST_SKIP() << "no /usr/bin/python3";
  const std::string python =
      "/usr/bin/python3 -B " + shellQuoted(SXR_PYTHON_EXAMPLE_PATH) + " --socket ";
  walk = run(python + shellQuoted(daemon.socket()) + " --reporter-id -7");
  EXPECT_EQ(walk.status, 0) << walk.output;
  EXPECT_EQ(walk.output, expectedWalk("True", -7));
  absent = run(python + shellQuoted(daemon.dir("no-such-socket")));
  EXPECT_EQ(absent.status, 1);
  EXPECT_NE(absent.output.find("sxreporting_client: "), std::string::npos) << absent.output;
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
  CommandRun outcome = run("/usr/bin/python3 -B -c " + shellQuoted(program) + " " +
                           shellQuoted(dir) + " " + shellQuoted(daemon.socket()));
  EXPECT_EQ(outcome.status, 0) << outcome.output;
  EXPECT_EQ(outcome.output,
            "SXReportingTimeout no reply within 0.2 s\n"
            "SXReportingError frobnicate:: unknown method 'frobnicate:'\n"
            "True\nheld\nTrue\n"
            "{'reporterID': 5, 'serviceType': 65535} [5]\n");
}

}  // namespace
