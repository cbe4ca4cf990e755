// `sxreportctl status`: the status reply for people and, with --metrics, as Prometheus text.
#include "tools/sxreportctl/CtlMetrics.h"

#include <gtest/gtest.h>

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
  std::string out;
  for (std::string line; std::getline(lines, line);) {
    if (!line.starts_with("# HELP ")) out += line + "\n";
  }
  return out;
}

TEST(CtlMetrics, TheFullStatusBecomesCountersWithLabelsAndGauges) {
  SXValue status = SXValue::parse(R"({
    "clients": [{"pid": 1, "sessions": []}], "reportingEnabled": true, "defaults": null,
    "counters": {
      "messages_received": 12,
      "messages_delivered": {"tallyvane": 5, "joulebook": 0, "fernreporting": 7},
      "guardrail_dropped": {"sessions_per_client": 1, "requests_backpressure": 2},
      "store_write_errors": {"fernreporting": 3}
    },
    "gauges": {"sessions_live": 4, "clients_live": 2, "spool_backlog": 0}
  })");
  // Each family's HELP line comes first; what it says is the tool's wording, not checked here.
  const std::string expected =
      "# TYPE sxreporting_up gauge\n"
      "sxreporting_up 1\n"
      "# TYPE sxreporting_reporting_enabled gauge\n"
      "sxreporting_reporting_enabled 1\n"
      "# TYPE sxreporting_guardrail_dropped_total counter\n"
      "sxreporting_guardrail_dropped_total{guardrail=\"requests_backpressure\"} 2\n"
      "sxreporting_guardrail_dropped_total{guardrail=\"sessions_per_client\"} 1\n"
      "# TYPE sxreporting_messages_delivered_total counter\n"
      "sxreporting_messages_delivered_total{sink=\"fernreporting\"} 7\n"
      "sxreporting_messages_delivered_total{sink=\"joulebook\"} 0\n"
      "sxreporting_messages_delivered_total{sink=\"tallyvane\"} 5\n"
      "# TYPE sxreporting_messages_received_total counter\n"
      "sxreporting_messages_received_total 12\n"
      "# TYPE sxreporting_store_write_errors_total counter\n"
      "sxreporting_store_write_errors_total{store=\"fernreporting\"} 3\n"
      "# TYPE sxreporting_clients_live gauge\n"
      "sxreporting_clients_live 2\n"
      "# TYPE sxreporting_sessions_live gauge\n"
      "sxreporting_sessions_live 4\n"
      "# TYPE sxreporting_spool_backlog gauge\n"
      "sxreporting_spool_backlog 0\n";
  const std::string text = SXCtlMetricsText(status);
  EXPECT_TRUE(isExposition(text)) << text;
  EXPECT_EQ(withoutHelp(text), expected);
}

TEST(CtlMetrics, AbsentOrMistypedPartsLeaveOnlyWhatIsKnown) {
  const std::string upOnly = "# TYPE sxreporting_up gauge\nsxreporting_up 1\n";
  // Entries with no number in them have no family at all, not an empty one.
  for (const SXValue& status :
       {SXValue(), SXValue::array({1, 2}),
        SXValue{{"counters", SXValue::object()}, {"reportingEnabled", "yes"}},
        SXValue{{"counters", 5}, {"gauges", {1, 2}}},
        SXValue{{"counters", {{"a", "x"}, {"b", {{"c", nullptr}}}, {"d", {1}}}}}}) {
    EXPECT_EQ(withoutHelp(SXCtlMetricsText(status)), upOnly) << status;
  }

  const std::string disabled = SXCtlMetricsText({{"reportingEnabled", false}});
  EXPECT_NE(disabled.find("\nsxreporting_reporting_enabled 0\n"), std::string::npos);
}

TEST(CtlMetrics, UnknownKeysGetSafeNamesEscapedLabelsTheGenericLabelAndNonFiniteSpellings) {
  SXValue status = {
      {"counters",
       {{"new-counter.x", 3},
        {"bytes_total", 8},
        {"by_queue", {{"a\"b\\c\nd", 1}, {"plain", 2.5}, {"skip", "text"}, {"deep", {{"x", 1}}}}},
        {"odd", {{"neg", -4}, {"flag", true}}}}},
      {"gauges",
       {{"up", 0},
        {"temperature", 36.6},
        {"per_pool", {{"io", 3}}},
        {"nan", std::numeric_limits<double>::quiet_NaN()},
        {"inf", std::numeric_limits<double>::infinity()},
        {"ninf", -std::numeric_limits<double>::infinity()}}}};
  const std::string text = SXCtlMetricsText(status);
  EXPECT_TRUE(isExposition(text)) << text;
  // Whole lines; "up" stays the tool's own: a gauge of that name cannot make a second family.
  for (const char* line :
       {"sxreporting_new_counter_x_total 3", "sxreporting_bytes_total 8",
        "sxreporting_by_queue_total{kind=\"a\\\"b\\\\c\\nd\"} 1",
        "sxreporting_by_queue_total{kind=\"plain\"} 2.5", "sxreporting_odd_total{kind=\"neg\"} -4",
        "sxreporting_odd_total{kind=\"flag\"} 1", "sxreporting_temperature 36.6",
        "sxreporting_per_pool{kind=\"io\"} 3", "sxreporting_nan NaN", "sxreporting_inf +Inf",
        "sxreporting_ninf -Inf", "sxreporting_up 1"}) {
    EXPECT_NE(text.find("\n" + std::string(line) + "\n"), std::string::npos) << line;
  }
  for (const char* absent : {"skip", "deep", "sxreporting_up 0", "_total_total"}) {
    EXPECT_EQ(text.find(absent), std::string::npos) << absent;
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
