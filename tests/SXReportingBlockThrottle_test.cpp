#include "Service/SXReportingBlockThrottle.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <future>
#include <limits>
#include <optional>
#include <stdexcept>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/FakeLog.h"
#include "fakes/ManualDispatch.h"

namespace {

using std::chrono::milliseconds;

constexpr SXReportingCategory kPlayback = 3;
constexpr SXReportingMessageType kStart = 1;

std::string key(const SXValue& payload, int64_t reporterID = 42) {
  return SXReportingBlockThrottle::buildMessageKey(payload, reporterID, kPlayback, kStart);
}

// A throttle on a manual dispatch and clock. Sends run on the test thread, inside `advance`,
// and record the manual time at which they ran.
struct Rig {
  struct Send {
    int id;
    double at;  // seconds since the rig was made
  };

  Rig() {
    SXLogScope scope;
    scope.shortName = "thrt";
    throttle = SXReportingBlockThrottle::create(dispatch, clock, log, log->registerScope(scope));
  }
  // Lets the worker end, so that its queued pass lets go of the throttle.
  ~Rig() {
    if (throttle) throttle->stop();
    advance(10);
  }

  void add(int id, const SXValue& payload, int64_t reporterID = 42) {
    auto send = [this, id] { sends.push_back({id, now()}); };
    throttle->addMessageBlock(send, reporterID, payload, kPlayback, kStart);
  }
  double now() const { return SXSecondsBetween(start, clock->now()); }
  void advance(double seconds) {
    dispatch->advance(std::chrono::duration_cast<std::chrono::nanoseconds>(
        std::chrono::duration<double>(seconds)));
  }

  std::shared_ptr<FakeLog> log = std::make_shared<FakeLog>(std::set<std::string>{"thrt"});
  std::shared_ptr<FakeClock> clock = std::make_shared<FakeClock>();
  std::shared_ptr<ManualDispatch> dispatch = std::make_shared<ManualDispatch>(clock);
  const SXDate start = clock->now();
  std::vector<Send> sends;
  std::shared_ptr<SXReportingBlockThrottle> throttle;
};

// ---- Message keys ----

// Two messages share a key exactly when their values' texts are equal, once the excluded
// fields' values are left out (their keys still count).
TEST(SXReportingBlockThrottleKeyTest, EqualKeysMeanEqualValuesBarTheExcludedOnes) {
  struct Row {
    SXValue a, b;
    bool same;
  };
  std::vector<Row> rows = {
      {{{"Volume", 0.5}, {"VolumeOperationTime", 3}},
       {{"Volume", 0.75}, {"VolumeOperationTime", 9}},
       true},
      {{{"Volume", 0.5}}, {{"Volume", 0.75}}, false},
      {{{"VolumeOperationTime", 1}}, {{"VolumeOperationTime", 2}}, false},
      {{{"b", 2}, {"_comparison_field_blacklist", {"b"}}},
       {{"b", 99}, {"_comparison_field_blacklist", {"b"}}},
       true},
      // A blacklist that is not an array is ignored.
      {{{"b", 2}, {"_comparison_field_blacklist", "b"}},
       {{"b", 99}, {"_comparison_field_blacklist", "b"}},
       false},
      // A payload that is not a dictionary counts as empty.
      {SXValue::array({1, 2}), SXValue::object(), true},
      {SXValue(), SXValue::object(), true},
      // Numbers compare by value, whatever their kind; booleans are the numbers 1 and 0.
      {{{"n", 1}}, {{"n", 1.0}}, true},
      {{{"n", {1, -2, 3u}}}, {{"n", {1.0, -2.0, 3.0}}}, true},
      {{{"n", {true}}}, {{"n", {1}}}, true},
      {{{"n", 1}}, {{"n", 1.5}}, false},
      {{{"n", 9007199254740993}}, {{"n", 9007199254740992.0}}, false},
      // At top level a string is its own text, so "1" and 1 meet; inside containers strings
      // are quoted and never meet a number.
      {{{"n", "1"}}, {{"n", 1}}, true},
      {{{"n", {"1"}}}, {{"n", {1}}}, false},
      {{{"n", {"a,b"}}}, {{"n", {"a", "b"}}}, false},
      {{{"n", {"a\"b"}}}, {{"n", {"a", "b"}}}, false},
      {{{"n", {nullptr}}}, {{"n", {"null"}}}, false},
  };
  for (const char* field : {"systemuptime_sec", "processuptime_ms", "sxreporting_timestamp",
                            "_throttle_seconds", "_comparison_field_blacklist"}) {
    rows.push_back({{{"a", 1}, {field, 1}}, {{"a", 1}, {field, "different"}}, true});
    rows.push_back({{{"a", 1}, {field, 1}}, {{"a", 1}}, false});
  }
  for (const Row& row : rows) EXPECT_EQ(key(row.a) == key(row.b), row.same) << row.a << row.b;
  EXPECT_NE(key({{"a", 1}}, 1), key({{"a", 1}}, -1));
  const SXValue empty = SXValue::object();
  EXPECT_NE(key(empty), SXReportingBlockThrottle::buildMessageKey(empty, 42, 1, kStart));
  EXPECT_NE(key(empty), SXReportingBlockThrottle::buildMessageKey(empty, 42, kPlayback, 2));
}

// ---- Throttle time ----

// Accepted values narrow to single precision; rejected ones fall back to 0.5 s with one info
// line of the default log.
TEST(SXReportingBlockThrottleSleepTimeTest, AcceptedValuesNarrowRejectedOnesFallBack) {
  struct Case {
    SXValue payload;
    double seconds;
    std::string line;  // "": none
  };
  const std::string large = "Rejecting large throttle time. {time=";
  const std::string notNumber = "Rejecting non Numbox value of throttle time. {time=";
  auto throttle = [](SXValue value) { return SXValue{{"_throttle_seconds", value}}; };
  const Case cases[] = {
      {{{"a", 1}}, 0.5, ""},
      {"not a dictionary", 0.5, ""},
      {throttle(4.9), 4.900000095367432, ""},
      {throttle(4), 4.0, ""},
      {throttle(-1), -1.0, ""},
      {throttle(-1e300), -std::numeric_limits<double>::infinity(), ""},
      {throttle(5u), 0.5, large + "5, max=5.000000}"},
      {throttle(5.0), 0.5, large + "5, max=5.000000}"},
      {throttle(7.5), 0.5, large + "7.5, max=5.000000}"},
      {throttle(std::nan("")), 0.5, large + "nan, max=5.000000}"},
      {throttle("2"), 0.5, notNumber + "2}"},
      {throttle(SXValue::array({1})), 0.5, notNumber + "[1]}"},
  };
  for (const auto& c : cases) {
    FakeLog log;
    EXPECT_EQ(SXReportingBlockThrottle::determineSleepTime(c.payload, log), c.seconds) << c.payload;
    ASSERT_EQ(log.lines().size(), c.line.empty() ? 0u : 1u) << c.payload;
    if (c.line.empty()) continue;
    EXPECT_EQ(log.lines()[0].message, c.line);
  }
}

// ---- The throttle ----

// Equal messages (here they differ only in excluded fields) give one send: the newest's
// operation, due its own throttle time after its own arrival, earlier or later than the time
// it replaces. A message of another key that arrives meanwhile joins the worker's schedule only
// once the re-armed entry has fired.
TEST(SXReportingBlockThrottleTest, DuplicateReArmsFromItsArrivalWithItsOwnTime) {
  struct Arrival {
    double after;  // seconds since the previous one
    std::optional<double> throttleSeconds;
  };
  struct Case {
    std::vector<Arrival> arrivals;
    double sentAfterLast;
  };
  for (const Case& c : std::vector<Case>{
           {{{0, std::nullopt}, {0.2, std::nullopt}, {0.2, std::nullopt}}, 0.5},
           {{{0, 1}, {0.1, 3}}, 3},
           {{{0, 4}, {0.1, 0}}, 0},
           {{{0, 4}, {0.1, -1}}, 0},
       }) {
    SCOPED_TRACE(c.sentAfterLast);
    Rig rig;
    int id = 0;
    SXValue payload;
    for (const Arrival& arrival : c.arrivals) {
      rig.advance(arrival.after);
      payload = {{"a", 1}, {"sxreporting_timestamp", ++id}};
      if (arrival.throttleSeconds) payload["_throttle_seconds"] = *arrival.throttleSeconds;
      rig.add(id, payload);
    }
    EXPECT_TRUE(rig.sends.empty());  // never on the caller's thread
    double lastAt = rig.now();
    rig.add(100, {{"b", 1}, {"_throttle_seconds", 0}});
    rig.advance(6);
    ASSERT_EQ(rig.sends.size(), 2u);
    EXPECT_EQ(rig.sends[0].id, id);
    EXPECT_NEAR(rig.sends[0].at - lastAt, c.sentAfterLast, 1e-6);
    EXPECT_EQ(rig.sends[1].id, 100);
    EXPECT_GT(rig.sends[1].at, rig.sends[0].at);
    EXPECT_LE(rig.sends[1].at - rig.sends[0].at, 0.1 + 1e-9);
    EXPECT_EQ(rig.log->count("Dropping duplicate message for " + key(payload)),
              c.arrivals.size() - 1);
  }
}

// The wait ends when the last entry has fired, or after 5 seconds while duplicates keep
// re-arming the entry, which is then still sent.
TEST(SXReportingBlockThrottleTest, WaitForCompletionEndsWhenIdleOrAfterFiveSeconds) {
  struct Case {
    std::optional<double> entrySeconds;  // none: idle
    int duplicateEveryMs;                // 0: none
    int returnsAtMs;
  };
  for (const Case& c : std::vector<Case>{{std::nullopt, 0, 0}, {1, 0, 1000}, {0.5, 300, 5000}}) {
    SCOPED_TRACE(c.returnsAtMs);
    Rig rig;
    int added = 0;
    auto addEntry = [&] { rig.add(++added, {{"a", 1}, {"_throttle_seconds", *c.entrySeconds}}); };
    if (c.entrySeconds) addEntry();
    auto waiter = std::async(std::launch::async, [&] { rig.throttle->waitForCompletion(); });
    // The time limit starts before this line, so time may move once it is written.
    if (c.returnsAtMs > 0) {
      ASSERT_TRUE(rig.log->waitFor("Waiting up to 5 seconds for blockThrottle queue to be empty."));
    }
    for (int ms = 100; ms <= c.returnsAtMs; ms += 100) {
      EXPECT_NE(waiter.wait_for(milliseconds(0)), std::future_status::ready) << ms;
      rig.advance(0.1);
      if (c.duplicateEveryMs && ms % c.duplicateEveryMs == 0 && ms < c.returnsAtMs) addEntry();
    }
    ASSERT_EQ(waiter.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    EXPECT_EQ(rig.log->countContaining("Giving up"), c.duplicateEveryMs ? 1u : 0u);
    rig.advance(1);  // an entry the wait gave up on is still sent, once
    EXPECT_EQ(rig.sends.size(), added ? 1u : 0u);
  }
}

// The worker survives an operation that throws or is missing, and holds the throttle, sending
// what it has, until stopped.
TEST(SXReportingBlockThrottleTest, WorkerOutlastsFailedOperationsAndHoldsTheThrottleUntilStopped) {
  Rig rig;
  std::weak_ptr<SXReportingBlockThrottle> weak = rig.throttle;
  rig.throttle->addMessageBlock([] { throw std::runtime_error("boom"); }, 1,
                                {{"_throttle_seconds", 0}}, kPlayback, kStart);
  rig.throttle->addMessageBlock(nullptr, 2, {{"_throttle_seconds", 0}}, kPlayback, kStart);
  rig.add(3, {{"a", 1}}, 3);
  rig.throttle.reset();
  rig.advance(0.5);
  EXPECT_EQ(rig.sends.size(), 1u);
  EXPECT_EQ(rig.log->count("Send operation failed: boom"), 1u);
  ASSERT_FALSE(weak.expired());
  EXPECT_EQ(weak.lock()->timersInFlightCount(), 0u);
  weak.lock()->stop();
  rig.advance(0.1);
  EXPECT_TRUE(weak.expired());
}

}  // namespace
