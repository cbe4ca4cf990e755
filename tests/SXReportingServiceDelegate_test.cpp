// The service delegate and its server instances, driven through fake connections with every
// platform facility doubled and the queues run by hand.
#include "SXReportingServiceDelegate.h"

#include <gtest/gtest.h>

#include "fakes/FakeIpc.h"
#include "support/TestEnvironment.h"

namespace {

// Records analytics events as log lines, so their order against other log lines shows.
class LoggingTallyvane final : public SXTallyvane {
 public:
  explicit LoggingTallyvane(std::shared_ptr<FakeLog> log) : log_(std::move(log)) {}
  bool sendEventLazy(const std::string& name, SXPayloadProvider provider) override {
    log_->write(nullptr, SXLogLevel::kDefault, "x:1:f: tallyvane " + name);
    payloads.push_back(provider());
    return true;
  }
  std::vector<SXValue> payloads;

 private:
  std::shared_ptr<FakeLog> log_;
};

struct Service {
  explicit Service(SXValue device = SXValue::object()) : t(std::move(device)) {
    SXPlatform platform = t.platform();
    tallyvane = std::make_shared<LoggingTallyvane>(t.log);
    platform.tallyvane = tallyvane;
    environment = std::make_shared<SXReportingEnvironment>(platform);
    environment->setBackendWaitSeconds(0.3);
    delegate = SXReportingServiceDelegate::init(environment);
  }
  ~Service() { t.drain(); }

  std::shared_ptr<FakeIpcConnection> connect(int32_t pid) {
    auto connection = std::make_shared<FakeIpcConnection>(pid);
    EXPECT_TRUE(delegate->shouldAcceptNewConnection(connection));
    return connection;
  }
  std::vector<FakeIpcConnection::Response> call(FakeIpcConnection& c, std::string_view method,
                                                SXValue params) {
    size_t before = c.responses().size();
    c.request(method, std::move(params));
    t.drain();
    auto all = c.responses();
    return {all.begin() + static_cast<long>(before), all.end()};
  }
  std::vector<std::string> messagesContaining(const std::vector<std::string>& fragments) {
    std::vector<std::string> out;
    for (const auto& m : t.log->messages()) {
      for (const auto& f : fragments) {
        if (m.find(f) != std::string::npos) out.push_back(f);
      }
    }
    return out;
  }

  TestEnvironment t;
  std::shared_ptr<LoggingTallyvane> tallyvane;
  std::shared_ptr<SXReportingEnvironment> environment;
  std::shared_ptr<SXReportingServiceDelegate> delegate;
};

const SXValue kPowerPayload = {{"EngineOnTime", 12.5}};

}  // namespace

TEST(SXReportingServiceDelegateInit, ScopeQueueNotificationAndDrivers) {
  Service s;
  auto scopes = s.t.log->registrations();
  ASSERT_GE(scopes.size(), 2u);
  EXPECT_EQ(scopes[0].shortName, "sxrs");
  EXPECT_EQ(scopes[0].code, 0x73787273u);
  EXPECT_EQ(scopes[0].category, "reporting_server_verbose");
  EXPECT_EQ(scopes[1].shortName, "sxrd");
  EXPECT_EQ(s.t.dispatch->createdQueues()[0], "com.vendra.sonex.reporting.server");
  EXPECT_EQ(s.t.notifications->registrationCount("com.vendra.sonex.reporting"), 1u);
  EXPECT_TRUE(s.t.log->contains("notify setup result 0"));
  EXPECT_FALSE(s.delegate->getDefaults());
  EXPECT_TRUE(s.delegate->isReportingEnabled());
}

TEST(SXReportingServiceDelegateClients, RegistrationRecordsStartDateAndProcessName) {
  Service s;
  s.t.process->names[77] = "player";
  auto player = s.connect(77);
  auto self = s.connect(s.t.process->processIdentifier());
  auto nobody = s.connect(0);
  EXPECT_TRUE(player->resumed());
  s.t.drain();
  const auto& clients = s.delegate->getAllClients();
  ASSERT_EQ(clients.size(), 3u);
  EXPECT_EQ(clients[0]->clientProcessName(), "player");
  EXPECT_EQ(clients[1]->clientProcessName(), "sxreportingd");
  EXPECT_FALSE(clients[2]->clientProcessName());
  EXPECT_EQ(clients[0]->clientStartDate(), s.t.clock->now());
}

TEST(SXReportingServiceDelegateRouting, AddressedHitsBridgesFirstBroadcastHitsSessionFirst) {
  Service s;
  auto c = s.connect(10);
  s.call(*c, sxr::method::kCreate, {42});
  s.call(*c, sxr::method::kSetConfiguration, {{{"HostApplicationDisplayID", "y"}}, 42});
  SXValue payload = {{"HostApplicationDisplayID", "x"}, {"EngineOnTime", 1}};
  auto reply = s.call(*c, sxr::method::kSendMessage, {payload, 3, 1, SXValue::array({42})});
  ASSERT_EQ(reply.size(), 1u);
  EXPECT_EQ(reply[0].result, nullptr);
  const std::vector<std::string> marks = {"tallyvane com.vendra.sonex.Playback.Start",
                                          "failed to get SXReporting timestamp for joulebook",
                                          "sending message for session owned by 42"};
  EXPECT_EQ(s.messagesContaining(marks), marks);
  EXPECT_EQ(s.tallyvane->payloads[0]["HostApplicationDisplayID"],
            "y");  // the session's, not the payload's
  EXPECT_EQ(s.t.joulebook->entries().size(), 1u);

  // Broadcast to a started session: the session first, then the bridges.
  s.call(*c, sxr::method::kStart, {42});
  auto before = s.t.log->messages().size();
  s.call(*c, sxr::method::kSendMessage, {kPowerPayload, 3, 1, nullptr});
  auto all = s.t.log->messages();
  std::vector<std::string> after(all.begin() + static_cast<long>(before), all.end());
  std::vector<std::string> seen;
  for (const auto& m : after) {
    for (const auto& f : marks) {
      if (m.find(f) != std::string::npos) seen.push_back(f);
    }
  }
  EXPECT_EQ(seen, (std::vector<std::string>{marks[2], marks[0], marks[1]}));
  EXPECT_TRUE(
      s.t.log->contains("active reporting sessions 1 : (<SXReportingSession reporterID=42"));
  s.call(*c, sxr::method::kStop, {42});
}

TEST(SXReportingServiceDelegateRouting, BroadcastWithoutStartedSessionsUsesTheDefaults) {
  Service s;
  s.t.preferences->setValue("com.vendra.sonex", "device_name", SXValue("bench"));
  s.t.notifications->post("com.vendra.sonex.reporting");
  s.t.drain();
  EXPECT_EQ(s.delegate->getDefaults(),
            (SXValue{{"device_name", "bench"}, {"disable_reporting", 0}}));
  auto c = s.connect(10);
  s.call(*c, sxr::method::kCreate, {42});
  s.call(*c, sxr::method::kSendMessage, {{{"a", 1}}, 3, 1, nullptr});
  auto single = s.t.fern->events(FakeFernReporting::Event::Kind::kSingleMessage);
  ASSERT_EQ(single.size(), 1u);
  EXPECT_EQ(single[0].userInfo[fern::kUserInfoServiceName], "standalone");
  EXPECT_TRUE(s.tallyvane->payloads.empty());
}

TEST(SXReportingServiceDelegateRouting, DisabledReportingAnswersTheErrorAndHidesOtherClients) {
  Service s;
  auto a = s.connect(10);
  auto b = s.connect(11);
  s.call(*a, sxr::method::kCreate, {42});
  s.t.preferences->setValue("com.vendra.sonex", "disable_reporting", SXValue("YES"));
  s.t.notifications->post("com.vendra.sonex.reporting");
  s.t.drain();
  EXPECT_FALSE(s.delegate->isReportingEnabled());
  auto reply = s.call(*a, sxr::method::kSendMessage, {{{"a", 1}}, 3, 1, SXValue::array({42})});
  EXPECT_EQ(reply[0].result, (SXValue{{"domain", "com.vendra.audio.reporting"}, {"code", 1}}));
  EXPECT_TRUE(s.tallyvane->payloads.empty());
  EXPECT_EQ(s.call(*b, sxr::method::kGetServiceType, {42})[0].result, 65535);  // service-wide: none
  EXPECT_FALSE(s.t.log->contains("failed to find reporting session 42"));
  s.call(*a, sxr::method::kSetServiceType, {2, 42});
  EXPECT_EQ(s.call(*a, sxr::method::kGetServiceType, {42})[0].result, 2);  // own map still works
}

TEST(SXReportingServiceDelegateDefaults, EveryNotificationReReadsAndUpdatesEverySession) {
  Service s;
  auto c = s.connect(10);
  s.call(*c, sxr::method::kCreate, {1});
  s.call(*c, sxr::method::kCreate, {2});
  for (int i = 0; i < 2; ++i) {
    s.t.notifications->post("com.vendra.sonex.reporting");
    s.t.drain();
  }
  EXPECT_EQ(s.t.log->count("re-reading sonex defaults"), 2u);
  EXPECT_TRUE(s.t.log->contains("defaults {\"disable_reporting\":0}"));
  for (const auto& [id, session] : s.delegate->getAllClients()[0]->clientReportingSessionMap()) {
    EXPECT_EQ(session->userInfo(), (SXValue{{"disable_reporting", 0}})) << id;
  }
  s.delegate->defaultsChanged(12345);  // another registration's token: ignored
  EXPECT_EQ(s.t.log->count("re-reading sonex defaults"), 2u);
}

TEST(SXReportingServiceDelegateConnections, InterruptThenInvalidateStopsOnceAndTimesTheClient) {
  Service s;
  s.t.process->names[10] = "player";
  auto c = s.connect(10);
  auto other = s.connect(11);
  s.call(*c, sxr::method::kCreate, {42});
  s.call(*c, sxr::method::kStart, {42});
  s.call(*c, sxr::method::kSendMessage, {{{"a", 1}}, 3, 1, SXValue::array({42})});
  s.t.clock->advance(2.5);

  c->end(true);
  s.t.drain();
  EXPECT_EQ(s.t.log->count("removing 10 from the server client list"), 1u);
  EXPECT_EQ(s.t.log->count("sending summary event for reporter 42"), 1u);
  EXPECT_EQ(s.t.log->count("InterruptionHandler: connection exited"), 1u);
  EXPECT_TRUE(
      s.t.log->contains("InvalidationHandler: connection exited process=player uptime_sec=2"));
  ASSERT_EQ(c->responses().size(), 3u);  // create, send, and the start held until the stop
  EXPECT_EQ(c->responses()[2].result, true);
  EXPECT_EQ(s.call(*other, sxr::method::kGetAllReporters, SXValue::array())[0].result,
            SXValue::array());
  ASSERT_EQ(s.tallyvane->payloads.size(), 2u);  // the message's event and the uptime event
  EXPECT_EQ(s.tallyvane->payloads[1], (SXValue{{"processName", "player"}, {"seconds", 2.5}}));
  EXPECT_TRUE(s.t.log->contains("dealloc 10 from the server client list"));
}

TEST(SXReportingServiceDelegateConnections, FallbacksWhenNameOrStartDateAreMissing) {
  Service s;
  auto early = s.connect(33);  // ends before its registration ran: no start date, no name
  early->end(false);
  s.t.drain();
  EXPECT_TRUE(s.t.log->contains("clientStartDate is nil. clientpid=33 clientprocessname=unknown"));
  EXPECT_TRUE(
      s.t.log->contains("InvalidationHandler: connection exited process=(null) uptime_sec=-1"));
  EXPECT_TRUE(s.t.log->contains("clientProcessName is nil. clientpid=33"));
  EXPECT_TRUE(s.tallyvane->payloads.empty());
}
