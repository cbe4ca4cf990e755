// The guardrails: session limits, request sizes, the aggregate caps, the standalone budget and
// the error-line budget. Each keeps what it refuses visible (error reply or log line, and a
// counter), and none loses a message it accepted.
#include "Statistics/SXReportingLimits.h"

#include <gtest/gtest.h>

#include <thread>

#include "common/SXThreadSafety.h"
#include "support/FakeService.h"

using namespace sxr::method;

TEST(SXReportingLimitsSessions, CreatesBeyondEitherLimitReplyTrueAndMakeNothing) {
  FakeService s({.maxSessionsPerClient = 2, .maxSessions = 3, .maxConnectionsPerClient = 1});
  auto a = s.connect(10);
  auto b = s.connect(11);
  for (int64_t id : {1, 2, 3}) EXPECT_EQ(s.call(*a, kCreate, {id}), true) << id;
  EXPECT_EQ(s.call(*a, kGetAllReporters, SXValue::array()), SXValue({1, 2}));
  EXPECT_TRUE(s.t.log->contains("(--max-sessions-per-client); reporter 3 not created"));
  EXPECT_EQ(s.call(*a, kCreate, {2}), true);  // replacing takes no new room
  EXPECT_EQ(s.dropped("sessions_per_client"), 1u);

  EXPECT_EQ(s.call(*b, kCreate, {4}), true);
  EXPECT_EQ(s.call(*b, kCreate, {5}), true);
  EXPECT_TRUE(s.t.log->contains("(--max-sessions); reporter 5 of client 11 not created"));
  EXPECT_EQ(s.dropped("sessions_total"), 1u);
  EXPECT_EQ(s.status()["gauges"]["sessions_live"], 3u);

  EXPECT_EQ(s.call(*a, kDestroy, {1}), true);
  EXPECT_EQ(s.status()["gauges"]["sessions_live"], 2u);
  EXPECT_EQ(s.call(*b, kCreate, {5}), true);
  EXPECT_EQ(s.call(*a, kGetAllReporters, SXValue::array()), SXValue({2, 4, 5}));

  // A process beyond its connection limit is refused until one of its connections ends.
  EXPECT_FALSE(s.delegate->shouldAcceptNewConnection(std::make_shared<FakeIpcConnection>(10)));
  EXPECT_TRUE(s.t.log->contains(
      "refusing a connection of process 10: it already has 1 (--max-connections-per-client)"));
  EXPECT_EQ(s.dropped("connections_per_client"), 1u);
  a->end(true);
  s.t.drain();
  a.reset();
  EXPECT_EQ(s.status()["gauges"]["sessions_live"], 2u);
  EXPECT_EQ(s.status()["gauges"]["clients_live"], 1u);
  EXPECT_TRUE(s.connect(10)->resumed());
}

// Entries are refused by count at once, and by bytes once the texts of earlier entries have
// been made on the session's queue; either way every message is still sent, and one error line
// says the summary is incomplete.
TEST(SXReportingLimitsAggregate, FullAggregateStillSendsAndSaysTheSummaryIsIncomplete) {
  struct Case {
    SXReportingLimits limits;
    SXReportingGuardrail guardrail;
    size_t kept;  // of 1 + 4 messages
  };
  const Case cases[] = {
      {{.maxAggregateEntries = 3}, SXReportingGuardrail::kAggregateEntries, 3},
      {{.maxAggregateBytes = 1}, SXReportingGuardrail::kAggregateBytes, 1},
      {{.maxAggregateBytesTotal = 1}, SXReportingGuardrail::kAggregateBytes, 1},
  };
  for (const Case& c : cases) {
    TestEnvironment t;
    auto environment = t.makeEnvironment(c.limits);
    auto session = SXReportingSession::initWithID(environment, 42, SXValue::array({1}));
    session->setServiceType(7);
    session->start();
    session->sendMessage({{"i", 0}}, 3, 1, nullptr);
    t.drain();
    for (int i = 1; i < 5; ++i) session->sendMessage({{"i", i}}, 3, 1, nullptr);
    EXPECT_EQ(session->aggregatedPayloadEntries().size(), c.kept);
    EXPECT_EQ(environment->counters().droppedBy(c.guardrail), 5 - c.kept);
    EXPECT_EQ(t.log->countContaining("aggregate of reporter 42 is full"), 1u);
    t.drain();
    EXPECT_EQ(t.fern->count("messages"), 5);
    // Messages left out are numbered all the same.
    EXPECT_EQ(session->messageTypeCounts(),
              (std::map<std::string, int64_t>{{"Playback_Start", 5}}));

    auto summary = session->createSummaryEventForSession();
    ASSERT_TRUE(summary);
    EXPECT_EQ(summary->size(), 1 + c.kept);  // the service type and the kept ids, nothing else
    session->stop();
    t.drain();
    EXPECT_EQ(environment->counters().aggregateBytes(), 0u);  // the stopped aggregate is gone
  }
}

TEST(SXReportingLimitsStandalone, AFullBudgetRefusesDelayedSendsAndCountsThem) {
  TestEnvironment t;  // its random source always draws 59
  auto environment = t.environment;
  // {"i": n} packs into 4 bytes: room for two delayed sends.
  auto budget = std::make_shared<SXReportingPendingBudget>(8, 10);
  auto session = SXReportingSession::initWithID(environment, 7, SXValue::array({10}), budget);
  session->setServiceType(4);  // alarms wait before a standalone send
  for (int i = 0; i < 4; ++i) session->sendMessage({{"i", i}}, 3, 1, nullptr);
  t.drain();

  using std::chrono::seconds;
  EXPECT_EQ(t.dispatch->delays(),
            (std::vector<std::chrono::nanoseconds>{seconds(59), seconds(59)}));
  EXPECT_EQ(t.fern->count("messages WHERE session_id IS NULL"), 2);
  EXPECT_EQ(environment->counters().droppedBy(SXReportingGuardrail::kStandalonePending), 2u);
  EXPECT_EQ(t.log->countContaining("(--max-pending-standalone-bytes 8)"), 1u);
  EXPECT_EQ(budget->pending(), 0u);  // every slot came back once its send ran
}

TEST(SXReportingLimitsStandalone, BudgetNeverExceedsItsCapacityUnderContention) {
  auto budget = std::make_shared<SXReportingPendingBudget>(100, 1);
  std::vector<std::thread> threads;
  SXMutex mutex;
  std::vector<std::shared_ptr<SXReportingPendingBudget::Slot>> held;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 1000; ++j) {
        auto slot = budget->tryAcquire(1);
        SXMutexLock lock(mutex);
        if (slot) held.push_back(std::move(slot));
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(held.size(), 100u);
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

// Requests over a size limit get an error reply naming the limit and change nothing; a list
// that names a session several times reaches it once.
TEST(SXReportingLimitsRequests, OversizedRequestsAreRefusedAndRepeatedIDsDeliverOnce) {
  FakeService s({.maxPayloadBytes = 64, .maxConfigurationBytes = 64, .maxReporterIDs = 3});
  auto c = s.connect(10);
  ASSERT_EQ(s.call(*c, kCreate, {7}), true);
  ASSERT_EQ(s.call(*c, kStart, {7}), "no reply");  // answered at stop
  SXValue big = {{"k", std::string(100, 'x')}};
  struct Case {
    const char* method;
    SXValue params;
    const char* error;  // a part of the error reply
    const char* guardrail;
  };
  const Case cases[] = {
      {kSendMessage, {big, 3, 1, {7}}, "(--max-payload-bytes)", "payload_bytes"},
      {kSetConfiguration, {big, 7}, "(--max-configuration-bytes)", "configuration_bytes"},
      {kSendMessage, {{{"k", 1}}, 3, 1, {1, 2, 3, 7}}, "(--max-reporter-ids)", "reporter_ids"},
  };
  for (const Case& k : cases) {
    c->request(k.method, k.params);
    s.t.drain();
    auto error = c->responses().back().error;
    ASSERT_TRUE(error.is_string()) << k.method;
    EXPECT_NE(error.get<std::string>().find(k.error), std::string::npos) << error;
    EXPECT_EQ(s.dropped(k.guardrail), 1u) << k.guardrail;
  }
  EXPECT_EQ(s.t.fern->count("messages"), 0);
  EXPECT_EQ(s.call(*c, kSendMessage, {{{"k", 1}}, 3, 1, {7, 7, 7}}), nullptr);
  s.t.drain();
  EXPECT_EQ(s.t.fern->count("messages"), 1);
  EXPECT_EQ(s.t.tallyvane->eventCount(), 1u);
}

// One client's unknown reporter IDs cost at most the per-minute number of error lines; the
// rest are counted and summed up in one line once the minute is over.
TEST(SXReportingLimitsErrorLines, ABadClientCostsAFewLinesAMinute) {
  FakeService s({.maxErrorLines = 2});
  auto c = s.connect(10);
  EXPECT_EQ(s.call(*c, kSendMessage, {{{"k", 1}}, 3, 1, {1, 2, 3, 4, 5}}), nullptr);
  EXPECT_EQ(s.t.log->countContaining("failed to find reporting session"), 2u);
  EXPECT_EQ(s.dropped("error_lines"), 3u);
  s.t.clock->advance(61);
  EXPECT_EQ(s.call(*c, kValid, {6}), (SXValue{{"reporterID", 0}, {"serviceType", 65535}}));
  EXPECT_TRUE(s.t.log->contains("client 10 caused 3 more error lines than the 2 a minute"));
  EXPECT_EQ(s.t.log->countContaining("failed to find reporting session"), 3u);
}
