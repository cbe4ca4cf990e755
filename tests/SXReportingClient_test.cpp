#include <gtest/gtest.h>

#include <atomic>

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

  FakeRpcServer server_;
  std::unique_ptr<SXReportingClient> client_ =
      std::make_unique<SXReportingClient>(SXClientOptions{server_.socketPath()});
};

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

// However the connection ends, every pending call completes, and later calls fail at once.
TEST_F(SXReportingClientTest, ConnectionLossCompletesEveryPendingCall) {
  server_.on(kStart, [](auto&) { return Answer::none(); });
  enum End { kServiceCloses, kServiceSendsGarbage, kClientDestroyed };
  const std::pair<End, std::string> cases[] = {
      {kServiceCloses, "the service closed the connection"},
      {kServiceSendsGarbage, "not MessagePack-RPC"},
      {kClientDestroyed, "the client closed the connection"},
  };
  for (const auto& [end, error] : cases) {
    SCOPED_TRACE(error);
    auto client = std::make_unique<SXReportingClient>(SXClientOptions{server_.socketPath()});
    ASSERT_TRUE(client->connect());
    const size_t before = server_.requests().size();
    std::vector<std::future<SXCallResult<bool>>> starts;
    for (int i = 1; i <= 3; ++i) {
      starts.push_back(client->startReportingSessionForID(i, kSXWaitForever));
    }
    ASSERT_TRUE(server_.waitForRequests(before + 3));
    if (end == kServiceCloses) server_.closeConnections();
    if (end == kServiceSendsGarbage) server_.sendBytes("\xc1");  // a byte MessagePack never uses
    if (end == kClientDestroyed) client.reset();
    for (auto& start : starts) {
      auto result = await(std::move(start));
      EXPECT_EQ(result.status, SXCallStatus::kConnectionLost);
      EXPECT_NE(result.error.find(error), std::string::npos) << result.error;
    }
    if (client) {
      EXPECT_FALSE(client->connected());
      EXPECT_EQ(await(client->createReportingSession(1)).status, SXCallStatus::kConnectionLost);
    }
  }
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
  std::atomic<int> delivered = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      std::vector<std::future<SXCallResult<std::optional<SXError>>>> sends;
      for (int i = 0; i < 2000; ++i) {
        sends.push_back(client_->sendMessage({{"i", i}}, 3, 1, std::vector<int64_t>{t}));
      }
      for (auto& send : sends) {
        auto result = await(std::move(send));
        delivered += result.replied() && !result.value;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(delivered, 4 * 2000);
}

}  // namespace
