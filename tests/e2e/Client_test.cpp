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
  auto answer = [&](const SXValue& result) {
    uint32_t msgid = server.next().msgid;
    server.reply(987654, nullptr, "stray");  // a msgid never sent, to be ignored
    server.reply(msgid, nullptr, result);
  };
  auto type = client.getServiceNameForReporterID(1);
  answer("two");
  EXPECT_EQ(await(std::move(type)).status, SXCallStatus::kBadReply);
  type = client.getServiceNameForReporterID(2);
  answer(70000);
  EXPECT_EQ(await(std::move(type)).status, SXCallStatus::kBadReply);
  auto all = client.getAllReporters();
  answer({1, "x"});
  EXPECT_EQ(await(std::move(all)).status, SXCallStatus::kBadReply);
  auto valid = client.reporterID(1);
  answer(SXValue::object());
  EXPECT_EQ(await(std::move(valid)).status, SXCallStatus::kBadReply);
  auto send = client.sendMessage(SXValue::object(), 1, 1, std::nullopt);
  answer({{"domain", 5}});
  auto sent = await(std::move(send));
  EXPECT_EQ(sent.status, SXCallStatus::kBadReply);
  EXPECT_NE(sent.error.find("domain"), std::string::npos);

  auto pending = client.startReportingSessionForID(1, kSXWaitForever);
  server.next();
  server.send("\xc1");  // a byte MessagePack never uses
  auto lost = await(std::move(pending));
  EXPECT_EQ(lost.status, SXCallStatus::kConnectionLost);
  EXPECT_NE(lost.error.find("not MessagePack-RPC"), std::string::npos) << lost.error;
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
  auto result = await(std::move(start));
  EXPECT_EQ(result.status, SXCallStatus::kTimedOut);
  EXPECT_EQ(result.error, "no reply within 100 ms");
  // Stopping the session sends the start's late reply, which does not disturb later calls.
  EXPECT_TRUE(replied(client->stopReportingSessionForID(5)));
  EXPECT_TRUE(replied(client->createReportingSession(6)));
  EXPECT_EQ(longer.wait_for(0s), std::future_status::timeout);  // its own time-out still runs
  SXReportingClient quick({daemon.socket(), 50ms});
  ASSERT_TRUE(quick.connect());
  EXPECT_EQ(await(quick.stopReportingSessionForID(0)).status, SXCallStatus::kTimedOut);

  // Callbacks run on the I/O thread, which they may destroy the client from.
  std::promise<std::thread::id> ran;
  client->createReportingSession(7, [&](SXCallResult<bool> created) {
    EXPECT_TRUE(created.value);
    client.reset();  // must neither deadlock nor crash
    ran.set_value(std::this_thread::get_id());
  });
  auto future = ran.get_future();
  ASSERT_EQ(future.wait_for(kGenerous), std::future_status::ready);
  EXPECT_NE(future.get(), std::this_thread::get_id());

  for (bool serviceDies : {false, true}) {
    client = daemon.client();
    std::vector<std::future<SXCallResult<bool>>> starts;
    for (int i = 0; i < 3; ++i) starts.push_back(client->startReportingSessionForID(0));
    replied(client->getAllReporters());  // answered after the daemon has read the starts
    if (serviceDies) {
      ::kill(daemon.pid(), SIGKILL);
    } else {
      client.reset();
    }
    const std::string error =
        serviceDies ? "the service closed the connection" : "the client closed the connection";
    for (auto& pending : starts) {
      auto lost = await(std::move(pending));
      EXPECT_EQ(lost.status, SXCallStatus::kConnectionLost);
      EXPECT_NE(lost.error.find(error), std::string::npos) << lost.error;
    }
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
// configuration's.
TEST_F(SXReportingCTest, ValuesTravelWithNilWhereCIsNullAndBadOnesAreRefusedBeforeSending) {
  FakeRpcServer server;
  connect(server.socketPath());
  struct Case {
    const char* json;
    const char* why;
  };
  const std::string tooDeep = nested(33);
  const std::string veryDeep(100000, '[');
  for (const Case& c :
       {Case{nullptr, "the message is NULL"}, Case{"{\"a\": ", "the message is not valid JSON"},
        Case{"[1, 2]", "the message is not a JSON object"},
        Case{"null", "the message is not a JSON object"},
        Case{tooDeep.c_str(), "the message is nested deeper than 32 levels"},
        Case{veryDeep.c_str(), "the message is nested deeper than 32 levels"}}) {
    bool delivered = true;
    EXPECT_EQ(sxr_send_message(client_, c.json, 3, 1, nullptr, 0, 0, &delivered), SXR_ERROR);
    EXPECT_EQ(lastError(), c.why);
    EXPECT_TRUE(delivered);  // untouched
  }
  EXPECT_EQ(sxr_send_message(client_, "{}", 3, 1, nullptr, 2, 0, nullptr), SXR_ERROR);
  EXPECT_EQ(lastError(), "reporter_ids is NULL but reporter_id_count is not 0");
  EXPECT_EQ(sxr_set_configuration(client_, "7", 1, 0, nullptr), SXR_ERROR);
  EXPECT_EQ(lastError(), "the configuration is not a JSON object or null");

  EXPECT_EQ(sxr_create_reporting_session(nullptr, 1, 0, nullptr), SXR_ERROR);
  EXPECT_EQ(sxr_client_connect("/nowhere", nullptr), SXR_ERROR);

  const std::pair<const char*, SXValue> configurations[] = {
      {R"({"b": [1, -2, 2.5], "a": "x"})", {{"a", "x"}, {"b", {1, -2, 2.5}}}},
      {nullptr, nullptr},
      {" null ", nullptr},
  };
  for (const auto& [json, value] : configurations) {
    auto configure = [&] { return sxr_set_configuration(client_, json, 7, 0, nullptr); };
    EXPECT_EQ(answered(server, configure, true).params, SXValue::array({value, 7}));
  }

  const int64_t ids[] = {4, -5};
  bool delivered = false;
  auto send = [&](const char* json, uint32_t category, const int64_t* to, size_t count) {
    return [&, json, category, to, count] {
      return sxr_send_message(client_, json, category, 65535, to, count, 0, &delivered);
    };
  };
  EXPECT_EQ(answered(server, send(R"({"k": 1})", 0xFFFFFFFFu, ids, 2), nullptr).params,
            SXValue::array({{{"k", 1}}, 0xFFFFFFFFu, 65535, SXValue::array({4, -5})}));
  EXPECT_TRUE(delivered);
  // Reporting disabled is a reply, not a failure.
  const SXValue disabled = {{"domain", kSXReportingErrorDomain}, {"code", 1}};
  EXPECT_EQ(answered(server, send("{}", 3, nullptr, 0), disabled).params,
            SXValue::array({SXValue::object(), 3, 65535, nullptr}));
  EXPECT_FALSE(delivered);
  EXPECT_EQ(answered(server, send("{}", 3, ids, 0), nullptr).params,
            SXValue::array({SXValue::object(), 3, 65535, SXValue::array()}));
  // As deep as the service accepts goes out.
  const std::string deepest = nested(32);
  answered(server, send(deepest.c_str(), 3, nullptr, 0), nullptr);

  bool result = true;
  std::string why;  // each thread has its own last error
  auto destroy = [&] {
    sxr_status status = sxr_destroy_reporting_session(client_, 1, 0, &result);
    why = lastError();
    return status;
  };
  answered(server, destroy, "not a bool", SXR_ERROR);
  EXPECT_NE(why.find("not a bool"), std::string::npos) << why;
  EXPECT_TRUE(result);  // untouched by a failure
}

// Against the service, which answers neither start nor stop of reporter 0, answers the start
// of a session when the session stops, refuses more reporter IDs than its limit and exits on
// kill.
TEST_F(SXReportingCTest, EveryOutcomeHasItsStatusAndMessage) {
  TestDaemon daemon({.extraArgs = {"--max-reporter-ids", "1"}});
  connect(daemon.socket());
  bool result = false;
  EXPECT_EQ(sxr_create_reporting_session(client_, 9, 0, &result), SXR_OK);
  EXPECT_TRUE(result);
  EXPECT_EQ(sxr_start_reporting_session_for_id(client_, 8, 0, &result), SXR_OK);
  EXPECT_FALSE(result);  // no such session
  uint16_t type = 0;
  EXPECT_EQ(sxr_get_service_name_for_reporter_id(client_, INT64_MAX, 0, &type), SXR_OK);
  EXPECT_EQ(type, 65535);
  char* status = nullptr;
  ASSERT_EQ(sxr_get_status(client_, 0, &status), SXR_OK);
  EXPECT_TRUE(SXValue::parse(status)["reportingEnabled"].is_boolean()) << status;
  sxr_free(status);
  EXPECT_STREQ(sxr_client_last_error(client_), "");

  // Waiting forever waits for the late reply.
  auto start = std::async(std::launch::async, [this] {
    bool started = false;
    return sxr_start_reporting_session_for_id(client_, 9, SXR_WAIT_FOREVER, &started) == SXR_OK &&
           started;
  });
  EXPECT_EQ(start.wait_for(std::chrono::milliseconds(kShort)), std::future_status::timeout);
  EXPECT_EQ(sxr_stop_reporting_session_for_id(client_, 9, 0, nullptr), SXR_OK);  // NULL: ignored
  EXPECT_TRUE(start.get());

  result = true;
  const int64_t ids[] = {1, 2};
  EXPECT_EQ(sxr_send_message(client_, "{}", 3, 1, ids, 2, 0, &result), SXR_ERROR);
  EXPECT_TRUE(lastError().starts_with("request rejected: ") &&
              lastError().ends_with("more than the limit of 1 (--max-reporter-ids)"))
      << lastError();
  EXPECT_TRUE(result);  // untouched by every failure

  // Each thread sharing the client keeps its own last error; a success clears it.
  EXPECT_EQ(sxr_stop_reporting_session_for_id(client_, 0, kShort, &result), SXR_TIMEOUT);
  const char* mine = sxr_client_last_error(client_);
  std::thread other([this] {
    EXPECT_STREQ(sxr_client_last_error(client_), "");
    EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, nullptr), SXR_OK);
  });
  other.join();
  EXPECT_STREQ(mine, "no reply within 200 ms");
  EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, nullptr), SXR_OK);
  EXPECT_STREQ(sxr_client_last_error(client_), "");

  EXPECT_EQ(sxr_kill_service(client_, 0), SXR_CONNECTION_LOST);
  EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, &result), SXR_CONNECTION_LOST);
  EXPECT_FALSE(lastError().empty());
}

// That the failure names the socket, ExamplesEndToEnd checks.
TEST(SXReportingCConnect, AFailedConnectStillGivesAUsableClient) {
  sxr_client* client = nullptr;
  EXPECT_EQ(sxr_client_connect("/nonexistent/dir/socket", &client), SXR_CONNECTION_LOST);
  ASSERT_NE(client, nullptr);
  EXPECT_EQ(sxr_get_all_reporters(client, 0, nullptr, nullptr), SXR_CONNECTION_LOST);
  sxr_client_close(client);
  sxr_client_close(nullptr);
}

}  // namespace
