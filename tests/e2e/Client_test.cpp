// The client library and its C interface against the daemon, and against a fake service for
// what the daemon never does: what goes over the wire, how replies reach the callers, and how
// every other outcome becomes a status and a message.
#include <gtest/gtest.h>

#include <atomic>
#include <csignal>
#include <functional>
#include <future>
#include <string>
#include <thread>

#include "fakes/FakeRpcServer.h"
#include "support/Daemon.h"
#include "sxreporting/sxreporting.h"

using namespace std::chrono_literals;

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

// Replies the real service would never send, and bytes that are no reply at all.
TEST(SXReportingClientTest, RepliesOfTheWrongShapeAreBadRepliesAndGarbageEndsTheConnection) {
  FakeRpcServer server;
  SXReportingClient client({server.socketPath()});
  ASSERT_TRUE(client.connect());
  // The reply to the call just made, after one to a msgid never sent, which is ignored.
  auto answered = [&](auto call, const SXValue& result) {
    uint32_t msgid = server.next().msgid;
    server.reply(987654, nullptr, "stray");
    server.reply(msgid, nullptr, result);
    return await(std::move(call)).status;
  };
  EXPECT_EQ(answered(client.getServiceNameForReporterID(1), "two"), SXCallStatus::kBadReply);
  EXPECT_EQ(answered(client.getServiceNameForReporterID(2), 70000), SXCallStatus::kBadReply);
  EXPECT_EQ(answered(client.getAllReporters(), {1, "x"}), SXCallStatus::kBadReply);
  EXPECT_EQ(answered(client.reporterID(1), SXValue::object()), SXCallStatus::kBadReply);
  EXPECT_EQ(answered(client.sendMessage(SXValue::object(), 1, 1, std::nullopt), {{"domain", 5}}),
            SXCallStatus::kBadReply);

  auto pending = client.startReportingSessionForID(1, kSXWaitForever);
  server.next();
  server.send("\xc1");  // a byte MessagePack never uses
  EXPECT_EQ(await(std::move(pending)).status, SXCallStatus::kConnectionLost);
}

// The service answers neither start nor stop of reporter 0, and answers the start of a session
// only when the session stops. However the connection ends, every pending call completes, and
// later calls fail at once. (Bytes that are not MessagePack-RPC end it too: see above.)
TEST(SXReportingClientTest, AgainstTheServiceEveryCallCompletes) {
  TestDaemon daemon;
  auto client = daemon.client();
  std::atomic<int> answered = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      std::vector<std::future<SXCallResult<std::optional<SXError>>>> sends;
      for (int i = 0; i < 2000; ++i) {
        sends.push_back(client->sendMessage({{"i", i}}, 3, 1, std::vector<int64_t>{t}));
      }
      for (auto& send : sends) answered += await(std::move(send)).replied();
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(answered, 4 * 2000);

  ASSERT_TRUE(replied(client->createReportingSession(5)));
  auto start = client->startReportingSessionForID(5, 100ms);
  auto longer = client->stopReportingSessionForID(0, 60s);
  EXPECT_EQ(await(std::move(start)).status, SXCallStatus::kTimedOut);
  // Stopping the session sends the start's late reply, which must reach no other call.
  EXPECT_TRUE(replied(client->stopReportingSessionForID(5)));
  EXPECT_EQ(longer.wait_for(0s), std::future_status::timeout);
  SXReportingClient quick({daemon.socket(), 50ms});
  ASSERT_TRUE(quick.connect());
  EXPECT_EQ(await(quick.stopReportingSessionForID(0)).status, SXCallStatus::kTimedOut);

  // Callbacks run on the I/O thread, which they may destroy the client from.
  std::promise<std::thread::id> ran;
  client->createReportingSession(7, [&](SXCallResult<bool>) {
    client.reset();  // must neither deadlock nor crash
    ran.set_value(std::this_thread::get_id());
  });
  auto future = ran.get_future();
  ASSERT_EQ(future.wait_for(kGenerous), std::future_status::ready);
  EXPECT_NE(future.get(), std::this_thread::get_id());

  for (bool serviceDies : {false, true}) {
    SCOPED_TRACE(serviceDies);
    client = daemon.client();
    auto pending = client->startReportingSessionForID(0);
    replied(client->getAllReporters());  // answered after the daemon has read the start
    if (serviceDies) {
      ::kill(daemon.pid(), SIGKILL);
    } else {
      client.reset();
    }
    EXPECT_EQ(await(std::move(pending)).status, SXCallStatus::kConnectionLost);
  }
  EXPECT_FALSE(client->connected());
  EXPECT_EQ(await(client->createReportingSession(1)).status, SXCallStatus::kConnectionLost);
}

constexpr int64_t kShort = 200;  // ms, for calls that are meant to time out

std::string nested(int levels) {
  std::string text;
  for (int i = 0; i < levels; ++i) text += "{\"a\":";
  text += "1";
  for (int i = 0; i < levels; ++i) text += "}";
  return text;
}

class SXReportingCTest : public ::testing::Test {
 protected:
  void connect(const std::string& socket) {
    ASSERT_EQ(sxr_client_connect(socket.c_str(), &client_), SXR_OK) << lastError();
  }
  void TearDown() override { sxr_client_close(client_); }

  // The request `call` made, answered with `result`; the call must end with `expected`.
  RpcRequest answered(FakeRpcServer& server, const std::function<sxr_status()>& call,
                      const SXValue& result, sxr_status expected = SXR_OK) {
    auto done = std::async(std::launch::async, call);
    RpcRequest request = server.next();
    server.reply(request.msgid, nullptr, result);
    EXPECT_EQ(done.get(), expected);
    return request;
  }

  std::string lastError() { return sxr_client_last_error(client_); }

  sxr_client* client_ = nullptr;
};

// Bad arguments are refused before anything is sent: the first request the fake reads is the
// first good call's.
TEST_F(SXReportingCTest, ValuesTravelWithNilWhereCIsNullAndBadOnesAreRefusedBeforeSending) {
  FakeRpcServer server;
  connect(server.socketPath());
  bool delivered = true;
  auto send = [&](const char* json, const int64_t* ids, size_t count) {
    return [&, json, ids, count] {
      return sxr_send_message(client_, json, 0xFFFFFFFFu, 65535, ids, count, 0, &delivered);
    };
  };
  auto configure = [&](const char* json) {
    return [&, json] { return sxr_set_configuration(client_, json, 7, 0, nullptr); };
  };
  const std::string veryDeep(100000, '[');
  const std::string tooDeep = nested(33);
  EXPECT_EQ(sxr_create_reporting_session(nullptr, 1, 0, nullptr), SXR_ERROR);
  EXPECT_EQ(sxr_client_connect("/nowhere", nullptr), SXR_ERROR);
  // A failed connect still gives a usable client (that the failure names the socket,
  // ExamplesEndToEnd checks).
  sxr_client* unconnected = nullptr;
  EXPECT_EQ(sxr_client_connect("/nonexistent/dir/socket", &unconnected), SXR_CONNECTION_LOST);
  EXPECT_EQ(sxr_get_all_reporters(unconnected, 0, nullptr, nullptr), SXR_CONNECTION_LOST);
  sxr_client_close(unconnected);
  sxr_client_close(nullptr);
  EXPECT_EQ(send("{}", nullptr, 2)(), SXR_ERROR);  // no IDs but a count
  EXPECT_EQ(configure("7")(), SXR_ERROR);
  const char* const bad[] = {nullptr, "{\"a\": ", "[1, 2]", veryDeep.c_str(), tooDeep.c_str()};
  for (const char* json : bad) {
    EXPECT_EQ(send(json, nullptr, 0)(), SXR_ERROR) << (json ? json : "NULL");
  }
  EXPECT_EQ(lastError(), "the message is nested deeper than 32 levels");
  EXPECT_TRUE(delivered);  // untouched

  // Each call, the reply the fake gives it, the parameters it sent and the delivery it reports.
  const int64_t ids[] = {4, -5};
  const std::string deepest = nested(32);  // as deep as the service accepts
  const SXValue disabled = {{"domain", kSXReportingErrorDomain}, {"code", 1}};
  auto sent = [](const SXValue& message, const SXValue& to) {
    return SXValue::array({message, 0xFFFFFFFFu, 65535, to});
  };
  bool result = true;
  const std::tuple<std::function<sxr_status()>, SXValue, SXValue, bool, sxr_status> rows[] = {
      {configure(R"({"b": [1, -2, 2.5], "a": "x"})"), true,
       SXValue::array({{{"a", "x"}, {"b", {1, -2, 2.5}}}, 7}), true, SXR_OK},
      {configure(nullptr), true, SXValue::array({nullptr, 7}), true, SXR_OK},
      {configure(" null "), true, SXValue::array({nullptr, 7}), true, SXR_OK},
      {send(R"({"k": 1})", ids, 2), nullptr, sent({{"k", 1}}, {4, -5}), true, SXR_OK},
      // Reporting disabled is a reply, not a failure.
      {send("{}", nullptr, 0), disabled, sent(SXValue::object(), nullptr), false, SXR_OK},
      {send("{}", ids, 0), nullptr, sent(SXValue::object(), SXValue::array()), true, SXR_OK},
      {send(deepest.c_str(), nullptr, 0), nullptr, sent(SXValue::parse(deepest), nullptr), true,
       SXR_OK},
      {[&] { return sxr_destroy_reporting_session(client_, 1, 0, &result); }, "not a bool",
       SXValue::array({1}), true, SXR_ERROR},
  };
  for (const auto& [call, reply, params, delivery, status] : rows) {
    SCOPED_TRACE(params.dump());
    EXPECT_EQ(answered(server, call, reply, status).params, params);
    EXPECT_EQ(delivered, delivery);
  }
  EXPECT_TRUE(result);  // untouched by a failure
}

// Against the service, which answers neither start nor stop of reporter 0, answers the start
// of a session when the session stops, refuses more reporter IDs than its limit and exits on
// kill.
TEST_F(SXReportingCTest, EveryOutcomeHasItsStatusAndMessage) {
  TestDaemon daemon({.extraArgs = {"--max-reporter-ids", "1"}});
  connect(daemon.socket());
  bool result = true;
  ASSERT_EQ(sxr_create_reporting_session(client_, 9, 0, &result), SXR_OK);
  // Waiting forever waits for the late reply, which stopping the session sends.
  auto start = std::async(std::launch::async, [this] {
    bool started = false;
    return sxr_start_reporting_session_for_id(client_, 9, SXR_WAIT_FOREVER, &started) == SXR_OK &&
           started;
  });
  EXPECT_EQ(start.wait_for(std::chrono::milliseconds(kShort)), std::future_status::timeout);
  uint16_t type = 0;
  const int64_t ids[] = {1, 2};
  // Each call, its status and the result it leaves; a failure leaves it untouched.
  const std::tuple<std::function<sxr_status()>, sxr_status, bool> rows[] = {
      {[&] { return sxr_create_reporting_session(client_, 10, 0, &result); }, SXR_OK, true},
      {[&] { return sxr_start_reporting_session_for_id(client_, 8, 0, &result); }, SXR_OK, false},
      {[&] { return sxr_get_service_name_for_reporter_id(client_, INT64_MAX, 0, &type); }, SXR_OK,
       true},
      {[&] { return sxr_stop_reporting_session_for_id(client_, 9, 0, nullptr); }, SXR_OK, true},
      {[&] { return sxr_send_message(client_, "{}", 3, 1, ids, 2, 0, &result); }, SXR_ERROR, true},
      {[&] { return sxr_stop_reporting_session_for_id(client_, 0, kShort, &result); }, SXR_TIMEOUT,
       true},
  };
  for (const auto& [call, status, expected] : rows) {
    result = true;
    EXPECT_EQ(call(), status);
    EXPECT_EQ(result, expected) << status;
  }
  EXPECT_EQ(type, 65535);
  EXPECT_TRUE(start.get());

  // Each thread sharing the client keeps its own last error.
  const char* mine = sxr_client_last_error(client_);
  std::thread other([this] { EXPECT_STREQ(sxr_client_last_error(client_), ""); });
  other.join();
  EXPECT_STREQ(mine, "no reply within 200 ms");
  EXPECT_EQ(sxr_kill_service(client_, 0), SXR_CONNECTION_LOST);
  EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, nullptr), SXR_CONNECTION_LOST);
}

}  // namespace
