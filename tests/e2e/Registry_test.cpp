// The session registry and the protocol's guard rails, through the real daemon.
#include <gtest/gtest.h>

#include "support/Daemon.h"
#include "support/RawSocket.h"

using namespace std::chrono_literals;

TEST(RegistryEndToEnd, RepliesForEachIDAndClientAndGuardsAgainstBadRequestsAndStreams) {
  TestDaemon daemon({.extraArgs = {"--log-scope", "sxrs=5", "--max-message-bytes", "65536",
                                   "--partial-frame-timeout-ms", "300"}});
  auto client = daemon.client();
  EXPECT_TRUE(replied(client->createReportingSession(42)));
  EXPECT_TRUE(replied(client->setServiceType(2, 42)));
  EXPECT_EQ(replied(client->getServiceNameForReporterID(42)), 2);
  EXPECT_EQ(replied(client->reporterID(42)), (SXReporterIDValidity{42, 2}));
  EXPECT_EQ(replied(client->reporterID(7)), (SXReporterIDValidity{0, 65535}));
  EXPECT_TRUE(replied(client->setConfiguration(SXValue{{"a", 1}}, 7)));
  EXPECT_TRUE(replied(client->setServiceType(3, 7)));  // unknown ID: still true

  // Reporter ID 0: one reply for get-type, none for set-type.
  std::atomic<int> replies{0};
  client->getServiceNameForReporterID(0, [&](SXCallResult<SXReportingServiceType> r) {
    EXPECT_EQ(r.value, 65535);
    ++replies;
  });
  EXPECT_EQ(client->setServiceType(2, 0, 500ms).get().status, SXCallStatus::kTimedOut);
  EXPECT_EQ(replies.load(), 1);
  // A reporter ID created twice: the second session replaces the first.
  EXPECT_TRUE(replied(client->createReportingSession(42)));
  EXPECT_EQ(replied(client->getServiceNameForReporterID(42)), 65535);
  EXPECT_EQ(replied(client->getAllReporters()), (std::vector<int64_t>{42}));

  EXPECT_TRUE(replied(client->stopReportingSessionForID(5)));
  EXPECT_TRUE(replied(client->destroyReportingSession(5)));
  for (auto status : {client->startReportingSessionForID(0, 300ms).get().status,
                      client->stopReportingSessionForID(0, 300ms).get().status,
                      client->destroyReportingSession(0, 300ms).get().status}) {
    EXPECT_EQ(status, SXCallStatus::kTimedOut);
  }
  ASSERT_TRUE(replied(client->createReportingSession(42)));
  auto first = client->startReportingSessionForID(42, kSXWaitForever);
  auto second = client->startReportingSessionForID(42, 500ms);
  EXPECT_EQ(second.get().status, SXCallStatus::kTimedOut);  // a repeated start gets no reply
  // Destroying a started session stops it first, which answers the held start.
  EXPECT_TRUE(replied(client->destroyReportingSession(42)));
  EXPECT_TRUE(first.get().value);
  // Bad requests get an error and change nothing.
  struct Case {
    std::string method;
    SXValue params;
    std::string says;
  };
  for (const auto& c : std::vector<Case>{
           {"nonsense:", SXValue::array(), "unknown method 'nonsense:'"},
           {sxr::method::kCreate, SXValue::array({1, 2}), "takes 1 param, got 2"},
           {sxr::method::kCreate, SXValue::array({"42"}), "(reporterID) must be a signed 64-bit"},
           {sxr::method::kSetServiceType, SXValue::array({70000, 42}),
            "(serviceType) out of range: 70000"},
           {sxr::method::kSendMessage, SXValue::array({1, 3, 1, nullptr}), "must be a dictionary"},
           {sxr::method::kSendMessage, SXValue::array({SXValue::object(), 3, 1, SXValue{1, "x"}}),
            "element 1 is not a signed 64-bit reporter ID"},
           {sxr::method::kSendMessage,
            SXValue::array({SXValue::object(), uint64_t{1} << 32, 1, nullptr}),
            "(category) out of range"},
           {sxr::method::kCreate, SXValue::array({uint64_t{1} << 63}), "out of range"}}) {
    auto result = client->call(c.method, c.params).get();
    EXPECT_EQ(result.status, SXCallStatus::kRemoteError) << c.method;
    EXPECT_NE(result.error.find(c.says), std::string::npos) << result.error;
  }
  EXPECT_EQ(replied(client->getAllReporters()), std::vector<int64_t>{});

  // Two clients and the service-wide lookup.
  auto one = daemon.client();
  auto two = daemon.client();
  ASSERT_TRUE(replied(one->createReportingSession(42)));
  ASSERT_TRUE(replied(one->setServiceType(2, 42)));
  ASSERT_TRUE(replied(one->createReportingSession(1)));
  ASSERT_TRUE(replied(two->createReportingSession(42)));
  ASSERT_TRUE(replied(two->setServiceType(3, 42)));
  ASSERT_TRUE(replied(two->createReportingSession(5)));

  auto third = daemon.client();
  EXPECT_EQ(replied(third->getServiceNameForReporterID(42)), 2);  // first-registered client's
  EXPECT_EQ(replied(third->getAllReporters()), (std::vector<int64_t>{1, 42, 5, 42}));

  // Own-map-only operations do not reach another client's session.
  EXPECT_TRUE(replied(third->setServiceType(7, 1)));
  EXPECT_TRUE(replied(third->destroyReportingSession(1)));
  EXPECT_EQ(replied(third->getServiceNameForReporterID(1)), 65535);  // still unnamed, still there
  EXPECT_EQ(replied(third->reporterID(1)), (SXReporterIDValidity{1, 65535}));
  // setConfiguration and reporterID:valid: do see other clients' sessions.
  EXPECT_EQ(replied(third->reporterID(5)), (SXReporterIDValidity{5, 65535}));
  // The verbose service scope logs each request at debug level.
  EXPECT_TRUE(daemon.waitForLog("<7>SXReportingServerInstance.cpp:"));

  // Broken streams end only their own connection.
  auto bystander = daemon.client();
  ASSERT_TRUE(replied(bystander->createReportingSession(9)));

  SXValue deep = 1;
  for (int i = 0; i < 33; ++i) deep = SXValue{{"k", deep}};
  std::vector<std::string> attacks = {
      std::string("\xc1\xc1\xc1\xc1", 4),  // not MessagePack
      SXTestRequest(
          1, sxr::method::kSendMessage,
          SXValue::array({{{"k", std::string(70000, 'x')}}, 3, 1, nullptr})),  // too large
      SXTestRequest(1, sxr::method::kSendMessage,
                    SXValue::array({deep, 3, 1, nullptr})),  // too deep
      SXTestRequest(1, sxr::method::kCreate, SXValue::array({1})).substr(0, 3) +
          std::string(70000, '\0'),         // a message that never ends
      std::string("\x93\x02\xa1m\x90", 5),  // a notification: no msgid to answer
      SXTestRequest(1, sxr::method::kCreate, SXValue::array({1})).substr(0, 3),  // cut short
  };
  for (const auto& bytes : attacks) {
    SXTestRawClient raw(daemon.socket());
    raw.send(bytes);
    EXPECT_TRUE(raw.closedByPeer());
  }
  EXPECT_TRUE(daemon.waitForLog("InterruptionHandler: connection exited", attacks.size()));
  // The bystander, connected for longer than the partial-frame timeout, is still served.
  EXPECT_EQ(replied(bystander->reporterID(9)), (SXReporterIDValidity{9, 65535}));
  EXPECT_EQ(replied(bystander->status())["counters"]["guardrail_dropped"]["partial_frames"], 1);
  EXPECT_FALSE(daemon.waitForExit(100ms));
}
