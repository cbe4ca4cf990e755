#include "SXReportingBlockThrottle.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <condition_variable>
#include <limits>
#include <mutex>
#include <stdexcept>
#include <thread>
#include <vector>

#include "fakes/FakeLog.h"

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr SXReportingCategory kPlayback = 3;
constexpr SXReportingMessageType kStart = 1;

double secondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

std::string key(const SXValue& payload, int64_t reporterID = 42) {
  return SXReportingBlockThrottle::buildMessageKey(payload, reporterID, kPlayback, kStart);
}

// Records which operations ran and when, and lets a test wait for them.
class SendRecorder {
 public:
  struct Send {
    int id;
    Clock::time_point at;
  };

  std::function<void()> operation(int id) {
    return [this, id] {
      {
        std::lock_guard lock(mutex_);
        sends_.push_back({id, Clock::now()});
      }
      changed_.notify_all();
    };
  }

  // Waits (generously) until `count` sends have happened; returns them all.
  std::vector<Send> waitFor(size_t count, double timeoutSeconds = 10) {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, std::chrono::duration<double>(timeoutSeconds),
                      [&] { return sends_.size() >= count; });
    return sends_;
  }

  std::vector<Send> sends() const {
    std::lock_guard lock(mutex_);
    return sends_;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Send> sends_;
};

class SXReportingBlockThrottleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    SXLogScope scope;
    scope.shortName = "thrt";
    scope_ = log_->registerScope(scope);
    throttle_ = SXReportingBlockThrottle::create(log_, scope_);
  }
  // The worker would otherwise hold the throttle, and its thread, for the rest of the process.
  void TearDown() override { throttle_->stop(); }

  void add(int id, const SXValue& payload, int64_t reporterID = 42) {
    throttle_->addMessageBlock(recorder_.operation(id), reporterID, payload, kPlayback, kStart);
  }

  // Waits until the worker has taken every new entry onto its schedule.
  void waitUntilScheduled() {
    auto deadline = Clock::now() + std::chrono::seconds(5);
    while (throttle_->unscheduledTimerKeysCount() > 0 && Clock::now() < deadline) {
      std::this_thread::sleep_for(milliseconds(2));
    }
    ASSERT_EQ(throttle_->unscheduledTimerKeysCount(), 0u);
  }

  void waitUntilIdle() {
    auto deadline = Clock::now() + std::chrono::seconds(10);
    while (throttle_->timersInFlightCount() > 0 && Clock::now() < deadline) {
      std::this_thread::sleep_for(milliseconds(5));
    }
    ASSERT_EQ(throttle_->timersInFlightCount(), 0u);
  }

  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>(std::set<std::string>{"thrt"});
  std::shared_ptr<const SXLogScope> scope_;
  SendRecorder recorder_;
  std::shared_ptr<SXReportingBlockThrottle> throttle_;
};

// ---- Message keys ----

TEST(SXReportingBlockThrottleKeyTest, KeyListsSortedFieldsThenReporterCategoryAndType) {
  EXPECT_EQ(key({{"b", 2}, {"a", "x"}, {"systemuptime_sec", 100}}),
            "a|x|b|2|systemuptime_sec|^|reporterID|42|Playback|Start");
  EXPECT_EQ(SXReportingBlockThrottle::buildMessageKey(SXValue::object(), 7, 1, 1),
            "reporterID|7|Generic|Start");
  EXPECT_EQ(key({{"a", 1}}, -1), "a|1|reporterID|-1|Playback|Start");
  EXPECT_NE(key({{"a", 1}}, 1), key({{"a", 1}}, -1));
  // Keys in byte order: upper case before "_" before lower case before non-ASCII.
  EXPECT_EQ(key({{"\xC3\xA9", 1}, {"a", 2}, {"_x", 3}, {"B", 4}}),
            "B|4|_x|3|a|2|\xC3\xA9|1|reporterID|42|Playback|Start");
  // Bad input: a payload that is not a dictionary counts as empty.
  EXPECT_EQ(key(SXValue::array({1, 2})), key(SXValue::object()));
  EXPECT_EQ(key(SXValue()), "reporterID|42|Playback|Start");
}

TEST(SXReportingBlockThrottleKeyTest, DefaultExclusionsHideValuesButNotKeys) {
  SXValue base = {{"a", 1}};
  for (const char* field : {"systemuptime_sec", "processuptime_ms", "sxreporting_timestamp",
                            "_throttle_seconds", "_comparison_field_blacklist"}) {
    SXValue one = base, two = base;
    one[field] = 1;
    two[field] = "different";
    EXPECT_EQ(key(one), key(two)) << field;
    EXPECT_NE(key(one), key(base)) << field;  // the excluded key itself still counts
  }
}

TEST(SXReportingBlockThrottleKeyTest, VolumePairExcludedOnlyTogether) {
  SXValue withTime = {{"Volume", 0.5}, {"VolumeOperationTime", 3}};
  SXValue otherVolume = {{"Volume", 0.75}, {"VolumeOperationTime", 9}};
  EXPECT_EQ(key(withTime), key(otherVolume));
  EXPECT_EQ(key(withTime), "Volume|^|VolumeOperationTime|^|reporterID|42|Playback|Start");
  EXPECT_NE(key({{"Volume", 0.5}}), key({{"Volume", 0.75}}));
  EXPECT_NE(key({{"VolumeOperationTime", 1}}), key({{"VolumeOperationTime", 2}}));
}

TEST(SXReportingBlockThrottleKeyTest, MessageBlacklistAppliesToThatMessageOnly) {
  SXValue listed = {{"a", 1}, {"b", 2}, {"_comparison_field_blacklist", {"b", 7}}};
  EXPECT_EQ(key(listed), "_comparison_field_blacklist|^|a|1|b|^|reporterID|42|Playback|Start");
  listed["b"] = 99;
  EXPECT_EQ(key(listed), "_comparison_field_blacklist|^|a|1|b|^|reporterID|42|Playback|Start");
  EXPECT_EQ(key({{"a", 1}, {"b", 2}}), "a|1|b|2|reporterID|42|Playback|Start");
  // Not an array: ignored, the default exclusions still apply.
  EXPECT_EQ(key({{"b", 2}, {"_comparison_field_blacklist", "b"}}),
            "_comparison_field_blacklist|^|b|2|reporterID|42|Playback|Start");
}

TEST(SXReportingBlockThrottleKeyTest, ValueTextIsEqualityPreserving) {
  // Numbers compare by value, whatever their kind; booleans are the numbers 1 and 0.
  EXPECT_EQ(key({{"n", 1}}), key({{"n", 1.0}}));
  EXPECT_EQ(key({{"n", SXValue::array({1, -2, 3u})}}),
            key({{"n", SXValue::array({1.0, -2.0, 3.0})}}));
  EXPECT_EQ(key({{"n", SXValue::array({true})}}), key({{"n", SXValue::array({1})}}));
  EXPECT_NE(key({{"n", 1}}), key({{"n", 1.5}}));
  EXPECT_EQ(key({{"n", 1e20}}), "n|100000000000000000000|reporterID|42|Playback|Start");
  EXPECT_EQ(key({{"n", 0.1}}), "n|0.1|reporterID|42|Playback|Start");
  EXPECT_NE(key({{"n", 9007199254740993}}), key({{"n", 9007199254740992.0}}));
  // At top level a string is its own text, so "1" and 1 meet; inside containers strings are
  // quoted and never meet a number.
  EXPECT_EQ(key({{"n", "1"}}), key({{"n", 1}}));
  EXPECT_NE(key({{"n", SXValue::array({"1"})}}), key({{"n", SXValue::array({1})}}));
  EXPECT_NE(key({{"n", SXValue::array({"a,b"})}}), key({{"n", SXValue::array({"a", "b"})}}));
  EXPECT_NE(key({{"n", SXValue::array({"a\"b"})}}), key({{"n", SXValue::array({"a", "b"})}}));
  EXPECT_NE(key({{"n", SXValue::array({nullptr})}}), key({{"n", SXValue::array({"null"})}}));
  // Dictionaries nest in ascending key order.
  EXPECT_EQ(key({{"d", {{"z", 1}, {"a", {{"y", "s"}}}}}}),
            "d|{\"a\":{\"y\":\"s\"},\"z\":1}|reporterID|42|Playback|Start");
}

// ---- Throttle time ----

TEST(SXReportingBlockThrottleSleepTimeTest, AcceptedValuesNarrowToSinglePrecision) {
  FakeLog log;
  auto sleepTime = [&](SXValue value) {
    return SXReportingBlockThrottle::determineSleepTime({{"_throttle_seconds", value}}, log);
  };
  EXPECT_EQ(SXReportingBlockThrottle::determineSleepTime({{"a", 1}}, log), 0.5);
  EXPECT_EQ(SXReportingBlockThrottle::determineSleepTime("not a dictionary", log), 0.5);
  EXPECT_EQ(sleepTime(4.9), 4.900000095367432);
  EXPECT_NEAR(sleepTime(4.99), 4.99, 1e-6);
  EXPECT_EQ(sleepTime(4), 4.0);
  EXPECT_EQ(sleepTime(0), 0.0);
  EXPECT_EQ(sleepTime(-1), -1.0);
  EXPECT_EQ(sleepTime(-1e300), -std::numeric_limits<double>::infinity());
  EXPECT_TRUE(log.lines().empty());
}

TEST(SXReportingBlockThrottleSleepTimeTest, RejectedValuesFallBackWithOneInfoLine) {
  struct Case {
    SXValue value;
    std::string line;
  };
  std::vector<Case> cases = {
      {5, "Rejecting large throttle time. {time=5, max=5.000000}"},
      {5u, "Rejecting large throttle time. {time=5, max=5.000000}"},
      {5.0, "Rejecting large throttle time. {time=5, max=5.000000}"},
      {7.5, "Rejecting large throttle time. {time=7.5, max=5.000000}"},
      {std::nan(""), "Rejecting large throttle time. {time=nan, max=5.000000}"},
      {"2", "Rejecting non Numbox value of throttle time. {time=2}"},
      {SXValue::array({1}), "Rejecting non Numbox value of throttle time. {time=[1]}"},
  };
  for (const auto& c : cases) {
    FakeLog log;
    SXValue payload = {{"_throttle_seconds", c.value}};
    EXPECT_EQ(SXReportingBlockThrottle::determineSleepTime(payload, log), 0.5) << c.line;
    ASSERT_EQ(log.lines().size(), 1u) << c.line;
    EXPECT_EQ(log.lines()[0].message, c.line);
    EXPECT_EQ(log.lines()[0].level, SXLogLevel::kInfo);
    EXPECT_EQ(log.lines()[0].scope, "");
  }
}

// ---- The throttle ----

TEST_F(SXReportingBlockThrottleTest, MessageIsSentOnceAfterItsThrottleTime) {
  auto start = Clock::now();
  add(1, {{"a", 1}});
  auto sends = recorder_.waitFor(1);
  ASSERT_EQ(sends.size(), 1u);
  double after = std::chrono::duration<double>(sends[0].at - start).count();
  EXPECT_GE(after, 0.49);
  EXPECT_LT(after, 1.5);
  waitUntilIdle();
  EXPECT_EQ(recorder_.sends().size(), 1u);
  EXPECT_GE(log_->count("calling workingRunLoop run from inside thread block"), 1u);
  // The worker logs its sleep after the last timer has run, so the line may come just after.
  EXPECT_TRUE(log_->waitFor("sleeping in thread"));
  for (const auto& line : log_->lines()) {
    if (line.level == SXLogLevel::kDebug) {
      EXPECT_EQ(line.scope, "thrt") << line.message;
    }
  }
}

TEST_F(SXReportingBlockThrottleTest, ZeroOrNegativeThrottleTimeSendsAtNextLook) {
  std::this_thread::sleep_for(milliseconds(150));  // let the worker settle into its idle poll
  for (int id : {1, 2}) {
    auto start = Clock::now();
    add(id, {{"id", id}, {"_throttle_seconds", id == 1 ? 0 : -1}});
    auto sends = recorder_.waitFor(id);
    ASSERT_EQ(sends.size(), size_t(id));
    EXPECT_LT(std::chrono::duration<double>(sends.back().at - start).count(), 0.4);
  }
}

TEST_F(SXReportingBlockThrottleTest, BurstOfEqualMessagesSendsOnlyTheNewest) {
  Clock::time_point lastAdd;
  for (int id : {1, 2, 3}) {
    if (id > 1) std::this_thread::sleep_for(milliseconds(200));
    lastAdd = Clock::now();
    add(id, {{"a", 1}, {"sxreporting_timestamp", id}});  // equal: the time stamp is excluded
  }
  auto sends = recorder_.waitFor(1);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].id, 3);
  double after = std::chrono::duration<double>(sends[0].at - lastAdd).count();
  EXPECT_GE(after, 0.49);
  EXPECT_LT(after, 1.5);
  waitUntilIdle();
  EXPECT_EQ(recorder_.sends().size(), 1u);
  EXPECT_EQ(log_->count("Dropping duplicate message for "
                        "a|1|sxreporting_timestamp|^|reporterID|42|Playback|Start"),
            2u);
}

// A duplicate re-arms from its own arrival with its own throttle time, and a message added
// while that timer runs joins the worker's schedule only after it has fired.
TEST_F(SXReportingBlockThrottleTest, DuplicateReArmsAndHoldsBackTheNextBatch) {
  add(1, {{"a", 1}, {"_throttle_seconds", 1}});
  waitUntilScheduled();
  auto duplicateAt = Clock::now();
  add(2, {{"a", 1}, {"_throttle_seconds", 3}});
  add(3, {{"b", 1}, {"_throttle_seconds", 0}});
  auto sends = recorder_.waitFor(2);
  ASSERT_EQ(sends.size(), 2u);
  EXPECT_EQ(sends[0].id, 2);
  EXPECT_EQ(sends[1].id, 3);
  double after = std::chrono::duration<double>(sends[0].at - duplicateAt).count();
  EXPECT_GE(after, 2.99);
  EXPECT_LT(after, 4.0);
  waitUntilIdle();
  EXPECT_EQ(recorder_.sends().size(), 2u);
}

TEST_F(SXReportingBlockThrottleTest, DuplicateCanBringADueTimeForward) {
  add(1, {{"a", 1}, {"_throttle_seconds", 4}});
  waitUntilScheduled();
  auto duplicateAt = Clock::now();
  add(2, {{"a", 1}, {"_throttle_seconds", 0}});
  auto sends = recorder_.waitFor(1);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].id, 2);
  EXPECT_LT(std::chrono::duration<double>(sends[0].at - duplicateAt).count(), 1.0);
}

TEST_F(SXReportingBlockThrottleTest, ThrowingOperationDoesNotStopTheWorker) {
  throttle_->addMessageBlock([] { throw std::runtime_error("boom"); }, 1,
                             {{"_throttle_seconds", 0}}, kPlayback, kStart);
  throttle_->addMessageBlock(nullptr, 2, {{"_throttle_seconds", 0}}, kPlayback, kStart);
  add(3, {{"_throttle_seconds", 0}}, 3);
  EXPECT_EQ(recorder_.waitFor(1).size(), 1u);
  waitUntilIdle();
  EXPECT_EQ(log_->count("Send operation failed: boom"), 1u);
}

TEST_F(SXReportingBlockThrottleTest, WaitForCompletionOnIdleThrottleReturnsAtOnce) {
  auto start = Clock::now();
  throttle_->waitForCompletion();
  EXPECT_LT(secondsSince(start), 0.4);
  EXPECT_EQ(log_->count("waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0"), 1u);
  EXPECT_FALSE(log_->contains("Waiting up to"));
}

TEST_F(SXReportingBlockThrottleTest, WaitForCompletionReturnsOnceTheEntryHasFired) {
  auto start = Clock::now();
  add(1, {{"_throttle_seconds", 1}});
  throttle_->waitForCompletion();
  double waited = secondsSince(start);
  EXPECT_GE(waited, 0.99);
  EXPECT_LT(waited, 2.5);
  EXPECT_EQ(recorder_.sends().size(), 1u);
  EXPECT_TRUE(log_->contains("waitForCompletion. timersInFlight=1 unscheduledTimerKeys="));
  EXPECT_EQ(log_->count("Waiting up to 5 seconds for blockThrottle queue to be empty."), 1u);
  EXPECT_FALSE(log_->contains("Giving up"));
}

TEST_F(SXReportingBlockThrottleTest, WaitForCompletionGivesUpWhileDuplicatesKeepArriving) {
  std::atomic<bool> waiting{true};
  std::atomic<int> added{0};
  Clock::time_point lastAdd;  // written by the adder, read after it is joined
  std::thread adder([&] {
    while (waiting.load()) {
      lastAdd = Clock::now();
      int id = added.load() + 1;
      add(id, {{"a", 1}});
      added = id;  // only once the entry is in the table
      std::this_thread::sleep_for(milliseconds(200));
    }
  });
  while (added.load() == 0) std::this_thread::yield();
  auto start = Clock::now();
  throttle_->waitForCompletion();
  double waited = secondsSince(start);
  waiting = false;
  adder.join();
  EXPECT_GE(waited, 4.99);
  EXPECT_LT(waited, 7.0);
  EXPECT_EQ(log_->count("Giving up on waiting for completion after 5 seconds. timersInFlight=1"),
            1u);
  for (const auto& line : log_->lines()) {
    if (line.message.starts_with("Giving up")) {
      EXPECT_EQ(line.level, SXLogLevel::kDefault);
    }
  }
  // The entry is still sent, once, after the last duplicate.
  auto sends = recorder_.waitFor(1);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].id, added.load());
  double after = std::chrono::duration<double>(sends[0].at - lastAdd).count();
  EXPECT_GE(after, 0.49);
  EXPECT_LT(after, 1.5);
}

TEST_F(SXReportingBlockThrottleTest, StopEndsTheWorkerAndReleasesTheThrottle) {
  add(1, {{"_throttle_seconds", 0}});
  recorder_.waitFor(1);
  std::weak_ptr<SXReportingBlockThrottle> weak = throttle_;
  throttle_->stop();
  EXPECT_FALSE(throttle_->shouldKeepRunning());
  throttle_.reset();
  EXPECT_TRUE(weak.expired());
  throttle_ = SXReportingBlockThrottle::create(log_, nullptr);  // for TearDown
}

}  // namespace
