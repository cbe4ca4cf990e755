#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>

#include "common/SXThreadSafety.h"
#include "fakes/FakeRpcServer.h"
#include "sxreporting/client.h"

using namespace std::chrono_literals;
using namespace sxr::method;
using Answer = FakeRpcServer::Answer;

namespace {

constexpr auto kGenerous = 10s;

template <typename T>
SXCallResult<T> await(std::future<SXCallResult<T>> future) {
  if (future.wait_for(kGenerous) != std::future_status::ready) {
    ADD_FAILURE() << "call did not complete";
    return {SXCallStatus::kTimedOut, T{}, "test gave up"};
  }
  return future.get();
}

class SXReportingClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string error;
    ASSERT_TRUE(client_->connect(&error)) << error;
  }

  SXValue paramsOf(const std::string& method) {
    for (const auto& request : server_.requests()) {
      if (request.method == method) return request.params;
    }
    return "no request";
  }

  FakeRpcServer server_;
  std::unique_ptr<SXReportingClient> client_ =
      std::make_unique<SXReportingClient>(SXClientOptions{server_.socketPath()});
};

TEST_F(SXReportingClientTest, EachOperationSendsItsParamsAndDecodesItsReply) {
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  server_.on(kSetServiceType, [](auto&) { return Answer::reply(true); });
  server_.on(kGetServiceType, [](auto&) { return Answer::reply(2); });
  server_.on(kSetConfiguration, [](auto&) { return Answer::reply(true); });
  server_.on(kStart, [](auto&) { return Answer::reply(false); });
  server_.on(kStop, [](auto&) { return Answer::reply(true); });
  server_.on(kDestroy, [](auto&) { return Answer::reply(false); });
  server_.on(kValid, [](auto&) { return Answer::reply({{"reporterID", 42}, {"serviceType", 2}}); });
  server_.on(kGetAllReporters, [](auto&) { return Answer::reply({1, -2, 3}); });
  server_.on(kStatus, [](auto&) { return Answer::reply({{"reportingEnabled", true}}); });

  auto& c = *client_;
  EXPECT_TRUE(await(c.createReportingSession(42)).value);
  EXPECT_TRUE(await(c.setServiceType(2, 42)).value);
  EXPECT_EQ(await(c.getServiceNameForReporterID(42)).value, 2);
  EXPECT_TRUE(await(c.setConfiguration(std::nullopt, 42)).value);
  EXPECT_FALSE(await(c.startReportingSessionForID(43)).value);
  EXPECT_TRUE(await(c.stopReportingSessionForID(42)).value);
  EXPECT_FALSE(await(c.destroyReportingSession(42)).value);
  EXPECT_EQ(await(c.reporterID(42)).value, (SXReporterIDValidity{42, 2}));
  EXPECT_EQ(await(c.getAllReporters()).value, (std::vector<int64_t>{1, -2, 3}));
  auto status = await(c.status());
  EXPECT_TRUE(status.replied());
  EXPECT_EQ(status.value["reportingEnabled"], true);

  EXPECT_EQ(paramsOf(kCreate), SXValue::array({42}));
  EXPECT_EQ(paramsOf(kSetServiceType), SXValue::array({2, 42}));
  EXPECT_EQ(paramsOf(kSetConfiguration), SXValue::array({nullptr, 42}));
  EXPECT_EQ(paramsOf(kStart), SXValue::array({43}));
  EXPECT_EQ(paramsOf(kGetAllReporters), SXValue::array());
  EXPECT_EQ(paramsOf(kStatus), SXValue::array());
}

TEST_F(SXReportingClientTest, SendMessageDistinguishesBroadcastAndReportsTheDisabledError) {
  server_.on(kSendMessage, [](const SXValue& params) {
    if (params[3].is_null()) return Answer::reply(nullptr);
    return Answer::reply({{"domain", kSXReportingErrorDomain}, {"code", 1}});
  });
  auto broadcast = await(client_->sendMessage({{"k", 1}}, 0x08000003, 1, std::nullopt));
  ASSERT_TRUE(broadcast.replied());
  EXPECT_FALSE(broadcast.value.has_value());

  auto none = await(client_->sendMessage({{"k", 1}}, 3, 2, std::vector<int64_t>{}));
  ASSERT_TRUE(none.replied()) << none.error;
  EXPECT_EQ(none.value, (SXError{kSXReportingErrorDomain, kSXReportingErrorReportingDisabled}));

  auto requests = server_.requests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0].params, SXValue::array({{{"k", 1}}, 0x08000003, 1, nullptr}));
  EXPECT_EQ(requests[1].params, SXValue::array({{{"k", 1}}, 3, 2, SXValue::array()}));
}

TEST_F(SXReportingClientTest, RepliesOfTheWrongShapeAreBadReplies) {
  server_.on(kGetServiceType, [](const SXValue& p) {
    return Answer::reply(p[0] == 1 ? SXValue("two") : SXValue(70000));
  });
  server_.on(kGetAllReporters, [](auto&) { return Answer::reply({1, "x"}); });
  server_.on(kValid, [](auto&) { return Answer::reply(SXValue::object()); });
  server_.on(kSendMessage, [](auto&) { return Answer::reply({{"domain", 5}}); });

  EXPECT_EQ(await(client_->getServiceNameForReporterID(1)).status, SXCallStatus::kBadReply);
  EXPECT_EQ(await(client_->getServiceNameForReporterID(2)).status, SXCallStatus::kBadReply);
  EXPECT_EQ(await(client_->getAllReporters()).status, SXCallStatus::kBadReply);
  EXPECT_EQ(await(client_->reporterID(1)).status, SXCallStatus::kBadReply);
  auto send = await(client_->sendMessage(SXValue::object(), 1, 1, std::nullopt));
  EXPECT_EQ(send.status, SXCallStatus::kBadReply);
  EXPECT_NE(send.error.find("domain"), std::string::npos);
}

TEST_F(SXReportingClientTest, RemoteErrorsCarryTheServiceText) {
  server_.on(kCreate, [](const SXValue& params) {
    if (!params[0].is_number_integer()) return Answer::fail("param 1 is not a reporter ID");
    return Answer::reply(true);
  });
  auto bad = await(client_->call(kCreate, SXValue::array({"forty-two"})));
  EXPECT_EQ(bad.status, SXCallStatus::kRemoteError);
  EXPECT_EQ(bad.error, "param 1 is not a reporter ID");

  auto unknown = await(client_->call("frobnicate:", SXValue::array()));
  EXPECT_EQ(unknown.status, SXCallStatus::kRemoteError);
  EXPECT_EQ(unknown.error, "unknown method frobnicate:");

  EXPECT_TRUE(await(client_->createReportingSession(1)).value);  // the connection goes on
}

TEST_F(SXReportingClientTest, ManyCallsInFlightMatchOutOfOrderReplies) {
  server_.on(kGetServiceType, [](auto&) { return Answer::none(); });
  constexpr int kCalls = 300;
  std::vector<std::future<SXCallResult<SXReportingServiceType>>> futures;
  for (int i = 0; i < kCalls; ++i) futures.push_back(client_->getServiceNameForReporterID(i));

  // Every request reaches the service before any reply exists: the calls are pipelined.
  ASSERT_TRUE(server_.waitForRequests(kCalls));
  auto requests = server_.requests();
  for (auto it = requests.rbegin(); it != requests.rend(); ++it) {
    server_.respond(it->msgid, nullptr, it->params[0].get<int>() + 1000);
  }
  for (int i = 0; i < kCalls; ++i) {
    auto result = await(std::move(futures[i]));
    ASSERT_TRUE(result.replied()) << i << ": " << result.error;
    EXPECT_EQ(result.value, i + 1000);
  }
}

TEST_F(SXReportingClientTest, WithheldReplyTimesOutAndItsLateReplyIsIgnored) {
  server_.on(kStop,
             [](const SXValue& p) { return p[0] == 0 ? Answer::none() : Answer::reply(true); });
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  auto stop = client_->stopReportingSessionForID(0, 100ms);
  auto longer = client_->stopReportingSessionForID(0, 60s);
  auto result = await(std::move(stop));
  EXPECT_EQ(result.status, SXCallStatus::kTimedOut);
  EXPECT_EQ(result.error, "no reply within 100 ms");
  EXPECT_EQ(longer.wait_for(0s), std::future_status::timeout);  // its own time-out still runs

  // Unknown msgids (this late reply, a made-up one) do not disturb later calls.
  server_.respond(server_.requests()[0].msgid, nullptr, true);
  server_.respond(987654, nullptr, "stray");
  EXPECT_TRUE(await(client_->createReportingSession(5)).value);
  EXPECT_TRUE(await(client_->stopReportingSessionForID(5)).value);
  EXPECT_EQ(longer.wait_for(0s), std::future_status::timeout);
}

TEST_F(SXReportingClientTest, DefaultTimeoutComesFromTheOptions) {
  server_.on(kKillService, [](auto&) { return Answer::none(); });
  SXReportingClient quick({server_.socketPath(), 50ms});
  ASSERT_TRUE(quick.connect());
  EXPECT_EQ(await(quick.killService()).status, SXCallStatus::kTimedOut);
}

TEST_F(SXReportingClientTest, ConnectionLossCompletesEveryPendingCall) {
  server_.on(kStart, [](auto&) { return Answer::none(); });
  std::vector<std::future<SXCallResult<bool>>> starts;
  for (int i = 1; i <= 5; ++i)
    starts.push_back(client_->startReportingSessionForID(i, kSXWaitForever));
  ASSERT_TRUE(server_.waitForRequests(5));
  server_.closeConnections();
  for (auto& start : starts) {
    auto result = await(std::move(start));
    EXPECT_EQ(result.status, SXCallStatus::kConnectionLost);
    EXPECT_EQ(result.error, "the service closed the connection");
  }
  EXPECT_FALSE(client_->connected());
  auto after = await(client_->createReportingSession(1));
  EXPECT_EQ(after.status, SXCallStatus::kConnectionLost);
  EXPECT_EQ(after.error, "the service closed the connection");
}

TEST_F(SXReportingClientTest, BytesThatAreNotMessagePackEndTheConnection) {
  server_.on(kValid, [](auto&) { return Answer::none(); });
  auto valid = client_->reporterID(1);
  ASSERT_TRUE(server_.waitForRequests(1));
  server_.sendBytes(std::string(1, '\xc1'));  // a byte MessagePack never uses
  auto result = await(std::move(valid));
  EXPECT_EQ(result.status, SXCallStatus::kConnectionLost);
  EXPECT_NE(result.error.find("not MessagePack-RPC"), std::string::npos) << result.error;
}

TEST_F(SXReportingClientTest, DestroyingTheClientCompletesPendingCalls) {
  server_.on(kStart, [](auto&) { return Answer::none(); });
  auto start = client_->startReportingSessionForID(1, kSXWaitForever);
  ASSERT_TRUE(server_.waitForRequests(1));
  client_.reset();
  auto result = await(std::move(start));
  EXPECT_EQ(result.status, SXCallStatus::kConnectionLost);
  EXPECT_EQ(result.error, "the client closed the connection");
}

TEST_F(SXReportingClientTest, CallbacksRunOnTheIoThreadWhichMayDestroyTheClient) {
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  std::promise<std::thread::id> ran;
  client_->createReportingSession(7, [&](SXCallResult<bool> result) {
    EXPECT_TRUE(result.value);
    client_.reset();  // must neither deadlock nor crash
    ran.set_value(std::this_thread::get_id());
  });
  auto future = ran.get_future();
  ASSERT_EQ(future.wait_for(kGenerous), std::future_status::ready);
  EXPECT_NE(future.get(), std::this_thread::get_id());
}

TEST_F(SXReportingClientTest, CallsFromManyThreadsAllComplete) {
  server_.on(kSendMessage, [](auto&) { return Answer::reply(nullptr); });
  constexpr int kThreads = 4;
  constexpr int kCallsEach = 2000;
  SXMutex mutex;
  std::condition_variable done;
  int completed = 0;
  std::atomic<int> delivered = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kCallsEach; ++i) {
        client_->sendMessage({{"i", i}}, 3, 1, std::vector<int64_t>{t},
                             [&](SXCallResult<std::optional<SXError>> result) {
                               if (result.replied() && !result.value) ++delivered;
                               SXMutexLock lock(mutex);
                               if (++completed == kThreads * kCallsEach) done.notify_one();
                             });
      }
    });
  }
  for (auto& thread : threads) thread.join();
  SXMutexLock lock(mutex);
  ASSERT_TRUE(lock.waitFor(
      done, 60s, [&]() SX_REQUIRES(mutex) { return completed == kThreads * kCallsEach; }));
  EXPECT_EQ(delivered, kThreads * kCallsEach);
}

TEST(SXReportingClientConnectTest, FailureSaysWhyAndCallsCompleteAtOnce) {
  SXReportingClient client({"/nonexistent/sxr/socket"});
  std::string error;
  EXPECT_FALSE(client.connect(&error));
  EXPECT_NE(error.find("/nonexistent/sxr/socket"), std::string::npos) << error;
  auto result = await(client.getAllReporters());
  EXPECT_EQ(result.status, SXCallStatus::kConnectionLost);
  EXPECT_EQ(result.error, error);

  SXReportingClient tooLong({std::string(200, 'x')});
  EXPECT_FALSE(tooLong.connect(&error));
}

}  // namespace
