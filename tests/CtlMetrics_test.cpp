// `sxreportctl status`: the status reply for people and, with --metrics, as Prometheus text.
#include "tools/sxreportctl/CtlMetrics.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <regex>
#include <set>
#include <sstream>

#include "tools/sxreportctl/CtlStatus.h"

namespace {

// Whether every line is a HELP, a TYPE or a sample of the text format 0.0.4, each family's
// samples follow its TYPE line, no family appears twice, and the text ends with a newline.
::testing::AssertionResult isExposition(const std::string& text) {
  static const std::regex help(R"(# HELP ([a-zA-Z_:][a-zA-Z0-9_:]*) ([^\\\n]|\\\\|\\n)*)");
  static const std::regex type(R"(# TYPE ([a-zA-Z_:][a-zA-Z0-9_:]*) (counter|gauge))");
  static const std::regex sample(
      R"(([a-zA-Z_:][a-zA-Z0-9_:]*)(\{[a-zA-Z_][a-zA-Z0-9_]*="([^"\\\n]|\\\\|\\"|\\n)*"\})? )"
      R"((-?[0-9]+(\.[0-9]+)?(e[+-]?[0-9]+)?|NaN|[+-]Inf))");
  if (text.empty() || text.back() != '\n') {
    return ::testing::AssertionFailure() << "no final newline";
  }
  std::istringstream lines(text);
  std::string line, family;
  std::set<std::string> seen;
  std::smatch m;
  while (std::getline(lines, line)) {
    if (std::regex_match(line, m, help)) {
      if (!seen.insert(m[1]).second) return ::testing::AssertionFailure() << "twice: " << line;
      family = m[1];
    } else if (std::regex_match(line, m, type) || std::regex_match(line, m, sample)) {
      if (m[1] != family) return ::testing::AssertionFailure() << "out of family: " << line;
    } else {
      return ::testing::AssertionFailure() << "not exposition: " << line;
    }
  }
  return ::testing::AssertionSuccess();
}

std::string withoutHelp(const std::string& text) {
  std::istringstream lines(text);
  std::string out = "\n";
  for (std::string line; std::getline(lines, line);) {
    if (!line.starts_with("# HELP ")) out += line + "\n";
  }
  return out;
}

// Each status, the runs of lines its text must hold (HELP lines aside, whose wording is the
// tool's), how many families it has and what it must not hold.
TEST(CtlMetrics, StatusBecomesExpositionText) {
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const double inf = std::numeric_limits<double>::infinity();
  struct Row {
    SXValue status;
    std::vector<std::string> lines;
    long families;  // TYPE lines
    std::vector<std::string> absent = {};
  };
  const Row rows[] = {
      // Known counters get their own label names; samples and families come sorted.
      {SXValue::parse(R"({"reportingEnabled": true, "counters": {"messages_received": 12,
          "messages_delivered": {"tallyvane": 5, "fernreporting": 7},
          "guardrail_dropped": {"sessions_per_client": 1, "requests_backpressure": 2},
          "store_write_errors": {"fernreporting": 3}}, "gauges": {"sessions_live": 4}})"),
       {"# TYPE sxreporting_up gauge\nsxreporting_up 1\n"
        "# TYPE sxreporting_reporting_enabled gauge\nsxreporting_reporting_enabled 1\n"
        "# TYPE sxreporting_guardrail_dropped_total counter\n"
        "sxreporting_guardrail_dropped_total{guardrail=\"requests_backpressure\"} 2\n"
        "sxreporting_guardrail_dropped_total{guardrail=\"sessions_per_client\"} 1\n"
        "# TYPE sxreporting_messages_delivered_total counter\n"
        "sxreporting_messages_delivered_total{sink=\"fernreporting\"} 7\n",
        "sxreporting_messages_received_total 12\n",
        "sxreporting_store_write_errors_total{store=\"fernreporting\"} 3\n",
        "# TYPE sxreporting_sessions_live gauge\nsxreporting_sessions_live 4\n"},
       7},
      {{{"reportingEnabled", false}}, {"sxreporting_reporting_enabled 0\n"}, 2},
      // Entries with no number in them have no family at all, not an empty one.
      {SXValue::array({1, 2}), {"sxreporting_up 1\n"}, 1},
      {{{"counters", {{"a", "x"}, {"b", {{"c", nullptr}}}, {"d", {1}}}},
        {"gauges", {1, 2}},
        {"reportingEnabled", "yes"}},
       {"sxreporting_up 1\n"},
       1},
      // Unknown keys get safe names, escaped labels, the generic label and non-finite
      // spellings; "up" stays the tool's own.
      {{{"counters",
         {{"new-counter.x", 3},
          {"bytes_total", 8},
          {"by_queue", {{"a\"b\\c\nd", 1}, {"plain", 2.5}, {"skip", "text"}, {"deep", {{"x", 1}}}}},
          {"odd", {{"neg", -4}, {"flag", true}}}}},
        {"gauges",
         {{"up", 0},
          {"temperature", 36.6},
          {"per_pool", {{"io", 3}}},
          {"nan", nan},
          {"inf", inf},
          {"ninf", -inf}}}},
       {"sxreporting_new_counter_x_total 3\n", "sxreporting_bytes_total 8\n",
        "sxreporting_by_queue_total{kind=\"a\\\"b\\\\c\\nd\"} 1\n"
        "sxreporting_by_queue_total{kind=\"plain\"} 2.5\n",
        "sxreporting_odd_total{kind=\"flag\"} 1\nsxreporting_odd_total{kind=\"neg\"} -4\n",
        "sxreporting_temperature 36.6\n", "sxreporting_per_pool{kind=\"io\"} 3\n",
        "sxreporting_nan NaN\n", "sxreporting_inf +Inf\n", "sxreporting_ninf -Inf\n",
        "sxreporting_up 1\n"},
       10,
       {"skip", "deep", "sxreporting_up 0", "_total_total"}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.status.dump());
    const std::string text = SXCtlMetricsText(row.status);
    EXPECT_TRUE(isExposition(text)) << text;
    const std::string lines = withoutHelp(text);
    for (const std::string& run : row.lines) {
      EXPECT_NE(lines.find("\n" + run), std::string::npos) << run << "in:" << lines;
    }
    EXPECT_EQ(std::count(lines.begin(), lines.end(), '#'), row.families) << lines;
    for (const std::string& absent : row.absent) {
      EXPECT_EQ(text.find(absent), std::string::npos) << absent;
    }
  }
}

// Unknown parts say so, and nested counters are indented under their name.
TEST(CtlStatus, ClientsSessionsAndCountersPrintWithUnknownPartsSaidSo) {
  SXValue status = SXValue::parse(R"({"reportingEnabled": true,
    "clients": [{"pid": 1234, "processName": "mixer", "uptimeSeconds": 12.5, "sessions": [
                  {"reporterID": 42, "serviceType": 2, "serviceName": "telephony", "started": true}]},
                {"pid": 99, "processName": null, "uptimeSeconds": null, "sessions": []}],
    "counters": {"messages_received": 7, "messages_delivered": {"fernreporting": 5}}})");
  const std::string text = SXCtlStatusText(status) + "\n";
  for (const char* line : {"  pid 1234 mixer, up 12.5 s\n    session 42: telephony (2), started\n",
                           "  pid 99 (unknown process), up unknown\n    (no sessions)\n",
                           "counters:\n  messages_delivered:\n    fernreporting = 5\n"}) {
    EXPECT_NE(text.find(line), std::string::npos) << text;
  }
}

}  // namespace
