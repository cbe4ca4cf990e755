// The service delegate and its server instances, driven through fake connections with every
// platform facility doubled and the queues run by hand; and the counters and gauges of
// `status:` that the delegate keeps.
#include "SXReportingServiceDelegate.h"

#include <gtest/gtest.h>

#include "support/FakeService.h"

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

struct Service : FakeService {
  Service()
      : FakeService({}, [](TestEnvironment& t, SXPlatform& platform) {
          platform.tallyvane = std::make_shared<LoggingTallyvane>(t.log);
        }) {}
  // Which of `fragments` the log lines from the `from`th on hold, in the order they came.
  std::vector<std::string> marks(const std::vector<std::string>& fragments, size_t from = 0) {
    std::vector<std::string> out;
    auto all = t.log->messages();
    for (size_t i = from; i < all.size(); ++i) {
      for (const auto& f : fragments) {
        if (all[i].find(f) != std::string::npos) out.push_back(f);
      }
    }
    return out;
  }

  const std::shared_ptr<LoggingTallyvane> tallyvane =
      std::static_pointer_cast<LoggingTallyvane>(platform.tallyvane);
};

SXValue delivered(uint64_t tallyvane, uint64_t joulebook, uint64_t fernreporting) {
  return {{"tallyvane", tallyvane}, {"joulebook", joulebook}, {"fernreporting", fernreporting}};
}

}  // namespace

TEST(SXReportingServiceDelegateRouting, AddressedHitsBridgesFirstBroadcastHitsSessionFirst) {
  Service s;
  auto c = s.connect(10);
  s.call(*c, sxr::method::kCreate, {42});
  s.call(*c, sxr::method::kSetConfiguration, {{{"HostApplicationDisplayID", "y"}}, 42});
  SXValue payload = {{"HostApplicationDisplayID", "x"}, {"EngineOnTime", 1}};
  EXPECT_EQ(s.call(*c, sxr::method::kSendMessage, {payload, 3, 1, SXValue::array({42})}), nullptr);
  const std::vector<std::string> marks = {"tallyvane com.vendra.sonex.Playback.Start",
                                          "failed to get SXReporting timestamp for joulebook",
                                          "sending message for session owned by 42"};
  EXPECT_EQ(s.marks(marks), marks);
  EXPECT_EQ(s.tallyvane->payloads[0]["HostApplicationDisplayID"],
            "y");  // the session's, not the payload's
  EXPECT_EQ(s.t.joulebook->entries().size(), 1u);

  // Broadcast to a started session: the session first, then the bridges.
  s.call(*c, sxr::method::kStart, {42});
  auto before = s.t.log->messages().size();
  s.call(*c, sxr::method::kSendMessage, {{{"EngineOnTime", 12.5}}, 3, 1, nullptr});
  EXPECT_EQ(s.marks(marks, before), (std::vector<std::string>{marks[2], marks[0], marks[1]}));
  EXPECT_TRUE(
      s.t.log->contains("active reporting sessions 1 : (<SXReportingSession reporterID=42"));
  s.call(*c, sxr::method::kStop, {42});
}

TEST(SXReportingCounters, EachSinkCountsWhatItAccepted) {
  FakeService s;
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
