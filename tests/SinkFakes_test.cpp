// The doubles other tests lean on: their delivery modes and their records must be right.
#include <gtest/gtest.h>

#include <future>
#include <thread>

#include "fakes/FakeFernReporting.h"
#include "fakes/FakeTallyvane.h"

using namespace std::chrono_literals;

namespace {

using Kind = FakeFernReporting::Event::Kind;
using Backends = std::optional<std::vector<std::string>>;

TEST(FakeFernReportingTest, RecordsEverythingInOneOrderedList) {
  FakeFernReporting fern;
  auto token = fern.newHierarchyToken(nullptr);
  auto session = fern.openSession({{fern::kSessionInfoHierarchyToken, token->identifier()}},
                                  {{fern::kUserInfoServiceName, "x_session"}}, {});
  std::optional<FernError> error;
  session->sendMessage(3, 1, {{"a", 1}}, error);
  fern.sendOneMessage({}, {{"k", "v"}}, 4, 2, {{"b", 2}}, error);
  session->flushMessages(nullptr);

  auto events = fern.events();
  ASSERT_EQ(events.size(), 5u);
  EXPECT_EQ(events[0].kind, Kind::kToken);
  EXPECT_EQ(events[1].kind, Kind::kOpen);
  EXPECT_EQ(events[1].session, 1);
  EXPECT_EQ(events[1].token, token->identifier());
  EXPECT_EQ(events[1].userInfo[fern::kUserInfoServiceName], "x_session");
  EXPECT_EQ(events[2].kind, Kind::kMessage);
  EXPECT_EQ(events[2].payload, (SXValue{{"a", 1}}));
  EXPECT_EQ(events[3].kind, Kind::kSingleMessage);
  EXPECT_EQ(events[3].userInfo, (SXValue{{"k", "v"}}));
  EXPECT_EQ(events[3].category, 4);
  EXPECT_EQ(events[4].kind, Kind::kFlush);
  EXPECT_EQ(fern.messages(1).size(), 1u);
}

TEST(FakeFernReportingTest, CompletionsComeFromAnotherThreadOnlyWhenTheTestSays) {
  FakeFernReporting fern;
  auto session = fern.openSession({}, {}, {});
  auto configure = [&] {
    auto got = std::make_shared<std::promise<std::pair<Backends, std::thread::id>>>();
    session->startConfiguration([got](Backends b) {
      got->set_value({b, std::this_thread::get_id()});
    });
    return got->get_future();
  };

  auto immediate = configure();
  ASSERT_EQ(immediate.wait_for(20s), std::future_status::ready);
  auto [backends, thread] = immediate.get();
  EXPECT_EQ(backends, (std::vector<std::string>{"fake"}));
  EXPECT_NE(thread, std::this_thread::get_id());

  fern.setBackends(std::nullopt);
  fern.setConfigurationDelivery(FakeFernReporting::Delivery::kNever);
  auto held = configure();
  EXPECT_EQ(held.wait_for(50ms), std::future_status::timeout);
  fern.deliverHeld();
  ASSERT_EQ(held.wait_for(20s), std::future_status::ready);
  EXPECT_EQ(held.get().first, std::nullopt);

  fern.setConfigurationDelivery(FakeFernReporting::Delivery::kDelayed, 100ms);
  auto start = std::chrono::steady_clock::now();
  auto delayed = configure();
  ASSERT_EQ(delayed.wait_for(20s), std::future_status::ready);
  EXPECT_GE(std::chrono::steady_clock::now() - start, 100ms);
}

TEST(FakeFernReportingTest, FailuresAreConfigurable) {
  FakeFernReporting fern;
  auto session = fern.openSession({}, {}, {});
  std::optional<FernError> error;
  fern.setMessageFailure({true, FernError{"no"}});
  EXPECT_FALSE(session->sendMessage(1, 1, {}, error));
  EXPECT_EQ(error->localizedDescription, "no");
  error.reset();
  fern.setSingleMessageFailure({true, std::nullopt});
  EXPECT_FALSE(fern.sendOneMessage({}, {}, 1, 1, {}, error));
  EXPECT_FALSE(error.has_value());
  EXPECT_FALSE(fern.events(Kind::kSingleMessage)[0].accepted);

  fern.setFlushError(FernError{"flush"});
  std::promise<std::optional<FernError>> flushed;
  session->flushMessages([&](std::optional<FernError> e) { flushed.set_value(e); });
  auto future = flushed.get_future();
  ASSERT_EQ(future.wait_for(20s), std::future_status::ready);
  EXPECT_EQ(future.get()->localizedDescription, "flush");

  fern.setOpenFails(true);
  fern.setTokenFails(true);
  EXPECT_EQ(fern.openSession({}, {}, {}), nullptr);
  EXPECT_EQ(fern.newHierarchyToken(nullptr), nullptr);
}

TEST(FakeTallyvaneTest, ProvidersRunWhereTheTestChooses) {
  FakeTallyvane inlined;
  inlined.sendEventLazy("a", [] { return SXValue{{"k", 1}}; });
  ASSERT_EQ(inlined.events().size(), 1u);
  EXPECT_EQ(inlined.events()[0].providerThread, std::this_thread::get_id());

  FakeTallyvane threaded(FakeTallyvane::Delivery::kOwnThread);
  threaded.sendEventLazy("b", [] { return SXValue(2); });
  ASSERT_TRUE(threaded.waitForEvents(1, 20s));
  EXPECT_NE(threaded.events()[0].providerThread, std::this_thread::get_id());
  EXPECT_EQ(threaded.events()[0].payload, 2);

  FakeTallyvane deferred(FakeTallyvane::Delivery::kOnDeliver);
  deferred.sendEventLazy("c", [] { return SXValue(3); });
  EXPECT_EQ(deferred.pending(), 1u);
  EXPECT_TRUE(deferred.events().empty());
  deferred.deliver();
  EXPECT_EQ(deferred.names(), std::vector<std::string>{"c"});

  deferred.setAccepts(false);
  EXPECT_FALSE(deferred.sendEventLazy("d", [] { return SXValue(); }));
  EXPECT_EQ(deferred.pending(), 0u);
}

}  // namespace
