// The guardrails: session limits, the aggregate cap and the standalone budget. Each must
// leave every reply as it is, keep what it refuses visible (log line, counter, summary key)
// and lose no message.
#include "SXReportingLimits.h"

#include <gtest/gtest.h>

#include <thread>

#include "SXReportingServiceDelegate.h"
#include "fakes/FakeIpc.h"
#include "support/TestEnvironment.h"

namespace {

using Kind = FakeFernReporting::Event::Kind;

std::shared_ptr<SXReportingEnvironment> limitedEnvironment(TestEnvironment& t,
                                                           SXReportingLimits limits) {
  auto environment = std::make_shared<SXReportingEnvironment>(t.platform(), limits);
  environment->setServerQueue(
      t.dispatch->createSerialQueue("server", SXQualityOfService::kUserInteractive));
  environment->setBackendWaitSeconds(0.3);
  return environment;
}

struct LimitedService {
  explicit LimitedService(SXReportingLimits limits)
      : environment(limitedEnvironment(t, limits)),
        delegate(SXReportingServiceDelegate::init(environment)) {}
  ~LimitedService() { t.drain(); }

  std::shared_ptr<FakeIpcConnection> connect(int32_t pid) {
    auto connection = std::make_shared<FakeIpcConnection>(pid);
    delegate->shouldAcceptNewConnection(connection);
    t.drain();
    return connection;
  }
  SXValue call(FakeIpcConnection& c, std::string_view method, SXValue params) {
    size_t before = c.responses().size();
    c.request(method, std::move(params));
    t.drain();
    auto all = c.responses();
    return all.size() > before ? all.back().result : SXValue("no reply");
  }
  SXValue status() {
    SXValue out;
    environment->serverQueue()->async([&] { out = delegate->statusSnapshot(); });
    t.drain();
    return out;
  }
  uint64_t dropped(const char* guardrail) {
    return status()["counters"]["guardrail_dropped"][guardrail].get<uint64_t>();
  }

  TestEnvironment t;
  std::shared_ptr<SXReportingEnvironment> environment;
  std::shared_ptr<SXReportingServiceDelegate> delegate;
};

}  // namespace

TEST(SXReportingLimitsSessions, CreatesBeyondEitherLimitReplyTrueAndMakeNothing) {
  LimitedService s({.maxSessionsPerClient = 2, .maxSessions = 3});
  auto a = s.connect(10);
  auto b = s.connect(11);
  for (int64_t id : {1, 2, 3}) EXPECT_EQ(s.call(*a, sxr::method::kCreate, {id}), true) << id;
  EXPECT_EQ(s.call(*a, sxr::method::kGetAllReporters, SXValue::array()), SXValue({1, 2}));
  EXPECT_TRUE(s.t.log->contains("session limit reached: client 10 already has 2 sessions "
                                "(--max-sessions-per-client); reporter 3 not created"));
  EXPECT_EQ(s.call(*a, sxr::method::kCreate, {2}), true);  // replacing takes no new room
  EXPECT_EQ(s.dropped("sessions_per_client"), 1u);

  EXPECT_EQ(s.call(*b, sxr::method::kCreate, {4}), true);
  EXPECT_EQ(s.call(*b, sxr::method::kCreate, {5}), true);
  EXPECT_TRUE(s.t.log->contains("session limit reached: the service already has 3 sessions "
                                "(--max-sessions); reporter 5 of client 11 not created"));
  EXPECT_EQ(s.dropped("sessions_total"), 1u);
  EXPECT_EQ(s.status()["gauges"]["sessions_live"], 3u);
  // A refused session really is absent: lookups miss it.
  EXPECT_EQ(s.call(*b, sxr::method::kValid, {5}),
            (SXValue{{"reporterID", 0}, {"serviceType", 65535}}));

  EXPECT_EQ(s.call(*a, sxr::method::kDestroy, {1}), true);
  EXPECT_EQ(s.call(*b, sxr::method::kCreate, {5}), true);
  EXPECT_EQ(s.call(*a, sxr::method::kGetAllReporters, SXValue::array()), SXValue({2, 4, 5}));
  EXPECT_EQ(s.dropped("sessions_total"), 1u);

  // A client that goes away gives its sessions back once its instance is gone.
  a->end(true);
  s.t.drain();
  a.reset();
  EXPECT_EQ(s.status()["gauges"], (SXValue{{"sessions_live", 2}, {"clients_live", 1}}));
}

TEST(SXReportingLimitsAggregate, FullAggregateStillSendsAndTheSummaryCountsTheRest) {
  TestEnvironment t;
  auto environment = limitedEnvironment(t, {.maxAggregateEntries = 3});
  auto session = SXReportingSession::initWithID(environment, 42, SXValue::array({1}));
  session->setServiceType(7);
  session->start();
  for (int i = 0; i < 5; ++i) session->sendMessage({{"i", i}}, 3, 1, nullptr);
  EXPECT_EQ(session->aggregatedPayloadEntries().size(), 3u);
  EXPECT_EQ(environment->counters().droppedBy(SXReportingGuardrail::kAggregateEntries), 2u);
  EXPECT_EQ(t.log->count("aggregate of reporter 42 is full (3 entries, --max-aggregate-entries); "
                         "further entries are sent but not aggregated"),
            1u);
  t.drain();
  EXPECT_EQ(t.fern->events(Kind::kMessage).size(), 5u);

  auto summary = session->createSummaryEventForSession();
  ASSERT_TRUE(summary);
  EXPECT_EQ((*summary)[SXReportingSession::kDroppedEntriesKey], "2");
  EXPECT_EQ(summary->size(), 5u);  // service type, three ids, the dropped count
  session->stop();
  t.drain();

  // A fresh start has room again, and a summary without drops has no such key.
  session->start();
  session->sendMessage({{"i", 9}}, 3, 1, nullptr);
  summary = session->createSummaryEventForSession();
  ASSERT_TRUE(summary);
  EXPECT_FALSE(summary->contains(SXReportingSession::kDroppedEntriesKey));
  session->stop();
}

TEST(SXReportingLimitsAggregate, NeverStartedSessionsAreCappedToo) {
  TestEnvironment t;
  auto environment = limitedEnvironment(t, {.maxAggregateEntries = 2});
  auto session = SXReportingSession::initWithID(environment, 7, SXValue::array({1}));
  for (int i = 0; i < 4; ++i) session->sendMessage({{"i", i}}, 3, 1, nullptr);
  EXPECT_EQ(session->aggregatedPayloadEntries().size(), 2u);
  t.drain();
  EXPECT_EQ(t.fern->events(Kind::kSingleMessage).size(), 4u);
  EXPECT_EQ(environment->counters().droppedBy(SXReportingGuardrail::kAggregateEntries), 2u);
}

TEST(SXReportingLimitsStandalone, AFullBudgetSendsAtOnceAndLosesNothing) {
  TestEnvironment t;  // its random source always draws 59
  auto environment = limitedEnvironment(t, {.maxPendingStandalone = 2});
  auto budget = std::make_shared<SXReportingPendingBudget>(2, 10);
  auto session = SXReportingSession::initWithID(environment, 7, SXValue::array({10}), budget);
  session->setServiceType(4);  // alarms wait before a standalone send
  for (int i = 0; i < 4; ++i) session->sendMessage({{"i", i}}, 3, 1, nullptr);
  t.drain();

  using std::chrono::seconds;
  std::vector<std::chrono::nanoseconds> delays = t.dispatch->delays();
  ASSERT_EQ(delays.size(), 4u);
  EXPECT_EQ(delays, (std::vector<std::chrono::nanoseconds>{seconds(59), seconds(59), seconds(0),
                                                           seconds(0)}));
  EXPECT_EQ(t.fern->events(Kind::kSingleMessage).size(), 4u);
  EXPECT_EQ(environment->counters().droppedBy(SXReportingGuardrail::kStandalonePending), 2u);
  EXPECT_EQ(t.log->count("client 10 has 2 standalone sends waiting for their delay "
                         "(--max-pending-standalone); sending further ones at once"),
            1u);
  EXPECT_EQ(budget->pending(), 0u);  // every slot came back once its send ran

  // With room again, sends wait as before.
  session->sendMessage({{"i", 9}}, 3, 1, nullptr);
  t.drain();
  EXPECT_EQ(t.dispatch->delays().back(), seconds(59));
}

TEST(SXReportingLimitsStandalone, BudgetNeverExceedsItsCapacityUnderContention) {
  auto budget = std::make_shared<SXReportingPendingBudget>(100, 1);
  std::vector<std::thread> threads;
  std::atomic<int> granted{0};
  std::mutex mutex;
  std::vector<std::shared_ptr<SXReportingPendingBudget::Slot>> held;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 1000; ++j) {
        if (auto slot = budget->tryAcquire()) {
          ++granted;
          std::lock_guard lock(mutex);
          held.push_back(std::move(slot));
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(granted.load(), 100);
  EXPECT_EQ(budget->pending(), 100u);
  EXPECT_TRUE(budget->firstRefusal());
  EXPECT_FALSE(budget->firstRefusal());
  held.resize(60);
  EXPECT_FALSE(budget->firstRefusal());  // still more than half full
  held.resize(50);
  EXPECT_TRUE(budget->firstRefusal());  // half full: the next overflow is news again
  held.clear();
  EXPECT_EQ(budget->pending(), 0u);
}
