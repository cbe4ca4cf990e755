// The counters and gauges of `status:`: what each sink accepted, what the daemon took in, and
// the numbers other parts of the daemon provide.
#include "SXReportingCounters.h"

#include <gtest/gtest.h>

#include "SXReportingServiceDelegate.h"
#include "fakes/FakeIpc.h"
#include "support/TestEnvironment.h"

namespace {

struct CountedService {
  CountedService() : delegate(SXReportingServiceDelegate::init(t.environment)) {}
  ~CountedService() { t.drain(); }

  std::shared_ptr<FakeIpcConnection> connect(int32_t pid) {
    auto connection = std::make_shared<FakeIpcConnection>(pid);
    delegate->shouldAcceptNewConnection(connection);
    t.drain();
    return connection;
  }
  void call(FakeIpcConnection& c, std::string_view method, SXValue params) {
    c.request(method, std::move(params));
    t.drain();
  }
  SXValue status() {
    SXValue out;
    t.environment->serverQueue()->async([&] { out = delegate->statusSnapshot(); });
    t.drain();
    return out;
  }

  TestEnvironment t;
  std::shared_ptr<SXReportingServiceDelegate> delegate;
};

SXValue delivered(uint64_t tallyvane, uint64_t joulebook, uint64_t fernreporting) {
  return {{"tallyvane", tallyvane}, {"joulebook", joulebook}, {"fernreporting", fernreporting}};
}

}  // namespace

TEST(SXReportingCounters, StatusHasTheSchemaWithEverythingAtZero) {
  CountedService s;
  SXValue status = s.status();
  EXPECT_EQ(status["counters"], (SXValue{{"messages_received", 0},
                                         {"messages_delivered", delivered(0, 0, 0)},
                                         {"guardrail_dropped",
                                          {{"sessions_per_client", 0},
                                           {"sessions_total", 0},
                                           {"aggregate_entries", 0},
                                           {"aggregate_bytes", 0},
                                           {"standalone_pending", 0},
                                           {"payload_bytes", 0},
                                           {"configuration_bytes", 0},
                                           {"reporter_ids", 0},
                                           {"error_lines", 0},
                       {"connections_per_client", 0},
                                           {"requests_backpressure", 0},
                                           {"partial_frames", 0}}}}));
  EXPECT_EQ(status["gauges"],
            (SXValue{{"sessions_live", 0}, {"clients_live", 0}, {"aggregate_bytes", 0}}));
  EXPECT_TRUE(status.contains("clients"));
  EXPECT_TRUE(status.contains("defaults"));
}

TEST(SXReportingCounters, EachSinkCountsWhatItAccepted) {
  CountedService s;
  auto c = s.connect(10);
  s.call(*c, sxr::method::kCreate, {42});
  s.call(*c, sxr::method::kStart, {42});
  s.call(*c, sxr::method::kSendMessage, {{{"EngineOnTime", 2}}, 3, 1, SXValue::array({42})});
  s.call(*c, sxr::method::kSendMessage, {{{"a", 1}}, 3, 1, SXValue::array({42})});
  EXPECT_EQ(s.status()["counters"]["messages_delivered"], delivered(2, 1, 2));

  // A send the spool refuses is not delivered; one that reaches no session is received only.
  s.t.fern->setMessageFailure({true, FernError{"full"}});
  s.call(*c, sxr::method::kSendMessage, {{{"a", 2}}, 3, 1, SXValue::array({42})});
  s.call(*c, sxr::method::kSendMessage, {{{"a", 3}}, 3, 1, SXValue::array({99})});
  SXValue counters = s.status()["counters"];
  EXPECT_EQ(counters["messages_received"], 4u);
  EXPECT_EQ(counters["messages_delivered"], delivered(3, 1, 2));

  // The stop's summary travels the session's path too; standalone sends count when accepted.
  s.t.fern->setMessageFailure({});
  s.call(*c, sxr::method::kStop, {42});
  s.call(*c, sxr::method::kSendMessage, {{{"a", 4}}, 3, 1, nullptr});
  counters = s.status()["counters"];
  EXPECT_EQ(counters["messages_received"], 5u);
  EXPECT_EQ(counters["messages_delivered"], delivered(3, 1, 4));
  EXPECT_EQ(s.t.joulebook->entries().size(), 1u);  // the counting forwarder forwards
}

TEST(SXReportingCounters, GaugesFollowClientsAndSessions) {
  CountedService s;
  auto a = s.connect(10);
  auto b = s.connect(11);
  s.call(*a, sxr::method::kCreate, {1});
  s.call(*a, sxr::method::kCreate, {1});  // replaced, not added
  s.call(*b, sxr::method::kCreate, {2});
  s.call(*b, sxr::method::kCreate, {3});
  EXPECT_EQ(s.status()["gauges"]["sessions_live"], 3u);
  EXPECT_EQ(s.status()["gauges"]["clients_live"], 2u);
  s.call(*b, sxr::method::kDestroy, {3});
  s.call(*b, sxr::method::kDestroy, {3});  // already gone: nothing to give back
  b->end(false);
  s.t.drain();
  b.reset();
  EXPECT_EQ(s.status()["gauges"]["sessions_live"], 1u);
  EXPECT_EQ(s.status()["gauges"]["clients_live"], 1u);
}

TEST(SXReportingCounters, ProvidedNumbersAppearUnderTheirKeys) {
  CountedService s;
  uint64_t backlog = 5;
  s.delegate->setStatusProviders({.requestsBackpressure = [] { return uint64_t{7}; },
                                  .tallyvaneWriteErrors = [] { return uint64_t{1}; },
                                  .joulebookWriteErrors = [] { return uint64_t{2}; },
                                  .fernReportingWriteErrors = [] { return uint64_t{3}; },
                                  .spoolBacklog = [&] { return backlog; }});
  SXValue status = s.status();
  EXPECT_EQ(status["counters"]["guardrail_dropped"]["requests_backpressure"], 7u);
  EXPECT_EQ(status["counters"]["store_write_errors"], delivered(1, 2, 3));
  EXPECT_EQ(status["gauges"]["spool_backlog"], 5u);
  backlog = 9;  // read afresh on every status
  EXPECT_EQ(s.status()["gauges"]["spool_backlog"], 9u);

  s.delegate->setStatusProviders({.spoolBacklog = [] { return uint64_t{0}; }});
  status = s.status();
  EXPECT_FALSE(status["counters"].contains("store_write_errors"));
  EXPECT_EQ(status["counters"]["guardrail_dropped"]["requests_backpressure"], 0u);
}
