// The C interface against a fake service: what goes over the wire, how replies reach the
// out-parameters, and how every other outcome becomes a status and a message.
#include <gtest/gtest.h>

#include <future>
#include <string>
#include <thread>

#include "fakes/FakeRpcServer.h"
#include "sxreporting/sxreporting.h"

using namespace sxr::method;
using Answer = FakeRpcServer::Answer;

namespace {

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
  void SetUp() override {
    ASSERT_EQ(sxr_client_connect(server_.socketPath().c_str(), &client_), SXR_OK)
        << sxr_client_last_error(client_);
  }
  void TearDown() override { sxr_client_close(client_); }

  SXValue lastParams(const std::string& method) {
    SXValue found = "no request";
    for (const auto& request : server_.requests()) {
      if (request.method == method) found = request.params;
    }
    return found;
  }

  std::string lastError() { return sxr_client_last_error(client_); }

  FakeRpcServer server_;
  sxr_client* client_ = nullptr;
};

// The operations the C example does not walk through against the daemon (ExamplesEndToEnd).
TEST_F(SXReportingCTest, EachOperationSendsItsParamsAndFillsItsOutParameters) {
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  server_.on(kGetServiceType, [](auto&) { return Answer::reply(65535); });
  server_.on(kStart, [](auto&) { return Answer::reply(false); });
  server_.on(kStop, [](auto&) { return Answer::reply(true); });
  server_.on(kStatus, [](auto&) { return Answer::reply({{"reportingEnabled", true}}); });

  bool result = false;
  EXPECT_EQ(sxr_create_reporting_session(client_, INT64_MAX, 0, &result), SXR_OK);
  EXPECT_EQ(lastParams(kCreate), SXValue::array({INT64_MAX}));
  uint16_t type = 0;
  EXPECT_EQ(sxr_get_service_name_for_reporter_id(client_, 5, 0, &type), SXR_OK);
  EXPECT_EQ(type, 65535);
  result = true;
  EXPECT_EQ(sxr_start_reporting_session_for_id(client_, 5, 0, &result), SXR_OK);
  EXPECT_FALSE(result);
  EXPECT_EQ(sxr_stop_reporting_session_for_id(client_, 5, 0, nullptr), SXR_OK);  // NULL: ignored
  char* status = nullptr;
  ASSERT_EQ(sxr_get_status(client_, 0, &status), SXR_OK);
  EXPECT_EQ(SXValue::parse(status), (SXValue{{"reportingEnabled", true}}));
  sxr_free(status);
  EXPECT_STREQ(sxr_client_last_error(client_), "");
}

TEST_F(SXReportingCTest, ConfigurationAndMessageTravelAsValuesWithNilWhereCIsNull) {
  server_.on(kSetConfiguration, [](auto&) { return Answer::reply(true); });
  int sends = 0;
  server_.on(kSendMessage, [&sends](auto&) {
    // The second send meets disabled reporting.
    return Answer::reply(++sends == 2 ? SXValue{{"domain", kSXReportingErrorDomain}, {"code", 1}}
                                      : SXValue());
  });

  EXPECT_EQ(sxr_set_configuration(client_, R"({"b": [1, -2, 2.5], "a": "x"})", 7, 0, nullptr),
            SXR_OK);
  EXPECT_EQ(lastParams(kSetConfiguration), SXValue::array({{{"a", "x"}, {"b", {1, -2, 2.5}}}, 7}));
  EXPECT_EQ(sxr_set_configuration(client_, nullptr, 7, 0, nullptr), SXR_OK);
  EXPECT_EQ(lastParams(kSetConfiguration), SXValue::array({nullptr, 7}));
  EXPECT_EQ(sxr_set_configuration(client_, " null ", 7, 0, nullptr), SXR_OK);
  EXPECT_EQ(lastParams(kSetConfiguration), SXValue::array({nullptr, 7}));

  const int64_t ids[] = {4, -5};
  bool delivered = false;
  EXPECT_EQ(sxr_send_message(client_, R"({"k": 1})", 0xFFFFFFFFu, 65535, ids, 2, 0, &delivered),
            SXR_OK);
  EXPECT_TRUE(delivered);
  EXPECT_EQ(lastParams(kSendMessage),
            SXValue::array({{{"k", 1}}, 0xFFFFFFFFu, 65535, SXValue::array({4, -5})}));
  EXPECT_EQ(sxr_send_message(client_, "{}", 3, 1, nullptr, 0, 0, &delivered), SXR_OK);
  EXPECT_FALSE(delivered);  // reporting disabled is a reply, not a failure
  EXPECT_EQ(lastParams(kSendMessage), SXValue::array({SXValue::object(), 3, 1, nullptr}));
  EXPECT_EQ(sxr_send_message(client_, "{}", 3, 1, ids, 0, 0, &delivered), SXR_OK);
  EXPECT_EQ(lastParams(kSendMessage), SXValue::array({SXValue::object(), 3, 1, SXValue::array()}));

  // As deep as the service accepts goes out.
  EXPECT_EQ(sxr_send_message(client_, nested(32).c_str(), 3, 1, nullptr, 0, 0, nullptr), SXR_OK);
}

TEST_F(SXReportingCTest, BadArgumentsAreRefusedBeforeAnythingIsSent) {
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
  EXPECT_TRUE(server_.requests().empty());
}

TEST_F(SXReportingCTest, EveryOutcomeWithoutAReplyHasItsStatusAndMessage) {
  server_.on(kStop, [](auto&) { return Answer::none(); });
  server_.on(kCreate, [](auto&) { return Answer::fail("createReportingSession:reply: nope"); });
  server_.on(kDestroy, [](auto&) { return Answer::reply("not a bool"); });

  bool result = true;
  EXPECT_EQ(sxr_stop_reporting_session_for_id(client_, 0, kShort, &result), SXR_TIMEOUT);
  EXPECT_EQ(lastError(), "no reply within 200 ms");
  EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, &result), SXR_ERROR);
  EXPECT_EQ(lastError(), "request rejected: createReportingSession:reply: nope");
  EXPECT_EQ(sxr_destroy_reporting_session(client_, 1, 0, &result), SXR_ERROR);
  EXPECT_NE(lastError().find("not a bool"), std::string::npos) << lastError();
  EXPECT_TRUE(result);  // untouched by every failure

  server_.on(kKillService, [this](auto&) {
    server_.closeConnections();
    return Answer::none();
  });
  EXPECT_EQ(sxr_kill_service(client_, 0), SXR_CONNECTION_LOST);
  EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, &result), SXR_CONNECTION_LOST);
  EXPECT_FALSE(lastError().empty());
}

TEST_F(SXReportingCTest, WaitForeverWaitsForALateReply) {
  server_.on(kStart, [](auto&) { return Answer::none(); });
  auto start = std::async(std::launch::async, [this] {
    bool result = false;
    sxr_status status = sxr_start_reporting_session_for_id(client_, 9, SXR_WAIT_FOREVER, &result);
    return status == SXR_OK && result;
  });
  ASSERT_TRUE(server_.waitForRequests(1));
  server_.respond(server_.requests()[0].msgid, nullptr, true);
  EXPECT_TRUE(start.get());
}

TEST_F(SXReportingCTest, ThreadsSharingAClientEachKeepTheirOwnLastError) {
  server_.on(kStop, [](auto&) { return Answer::none(); });
  server_.on(kCreate, [](auto&) { return Answer::reply(true); });
  ASSERT_EQ(sxr_stop_reporting_session_for_id(client_, 0, kShort, nullptr), SXR_TIMEOUT);
  const char* mine = sxr_client_last_error(client_);

  std::thread other([this] {
    EXPECT_STREQ(sxr_client_last_error(client_), "");
    EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, nullptr), SXR_OK);
  });
  other.join();
  EXPECT_STREQ(mine, "no reply within 200 ms");
  EXPECT_EQ(sxr_create_reporting_session(client_, 1, 0, nullptr), SXR_OK);
  EXPECT_STREQ(sxr_client_last_error(client_), "");  // a success clears it
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
