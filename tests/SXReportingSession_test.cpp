#include "Service/SXReportingSession.h"

#include <gtest/gtest.h>

#include <thread>

#include "Statistics/SXReportingUtility.h"
#include "linux/AsioDispatch.h"
#include "linux/SystemRandom.h"
#include "sqlite/SqliteFernReporting.h"
#include "support/TestEnvironment.h"

namespace {

std::shared_ptr<SXReportingSession> makeSession(TestEnvironment& t, int64_t id = 42,
                                                SXReportingServiceType type = 7) {
  auto session = SXReportingSession::initWithID(t.environment, id, SXValue::array({1234}));
  session->setServiceType(type);
  return session;
}

SXValue internalBuild(int deviceClass = 1) {
  return {{"InternalBuild", true}, {"DeviceClassNumber", deviceClass}};
}

// The summary files that sessions `ids` of host application `host` leave on an internal
// build, each name from the host part on. The host name comes from a client and stands in the
// name as it is, but must never name another directory or overrun a name (that it stays one
// name in its directory, FuzzCorpus checks).
std::vector<std::string> summaryNames(const SXValue& host, std::vector<int64_t> ids = {42}) {
  TestEnvironment t(SXValue{{"InternalBuild", true}});
  SXValue config = {{"HostApplicationDisplayID", host}};
  for (int64_t id : ids) {
    auto session = makeSession(t, id);
    session->setConfiguration(&config);
    session->start();
    session->sendMessage({{"n", id}}, 3, 1, nullptr);
    EXPECT_TRUE(session->createSummaryEventForSession());
  }
  t.drain();
  std::vector<std::string> names;
  for (const auto& [path, contents] : t.fileSystem->files) {
    names.push_back(path.substr(path.find("-sonex-") + 7));
  }
  return names;
}

// The part of the single summary file's name that the host application name became.
std::string hostPart(const SXValue& host) {
  auto names = summaryNames(host);
  EXPECT_EQ(names.size(), 1u);
  return names.empty() ? "" : names[0].substr(0, names[0].rfind("-longformaudio.json"));
}

}  // namespace

TEST(SXReportingSessionMessages, NumberingRewriteAndAggregate) {
  TestEnvironment t;
  auto session = makeSession(t);
  EXPECT_EQ(session->messageIdForCategory(3, 1), "Playback_Start_1");
  EXPECT_EQ(session->messageIdForCategory(3, 1), "Playback_Start_2");
  EXPECT_EQ(session->messageIdForCategory(0x08000003, 1), "Session_Playback_Start_1");
  // Far more kinds than the name cache keeps: a cached name is still the right one.
  for (uint32_t category = 0; category < 600; ++category) {
    ASSERT_EQ(SXReportingUtilityMessageKind(category, 2).ends_with("_Stop"), true) << category;
  }
  EXPECT_EQ(SXReportingUtilityMessageKind(0x08000003, 1), "Session_Playback_Start");

  session->start();
  EXPECT_FALSE(session->createSummaryEventForSession());
  SXValue payload = {{"peak level", 1}, {"route", "a b"}, {"a b", 1}, {"a_b", 2}};
  int replies = 0;
  session->sendMessage(payload, 3, 1, [&](std::optional<FernError> error) {
    EXPECT_FALSE(error);
    ++replies;
  });
  EXPECT_EQ(replies, 1);  // at once, before the send task ran
  auto entries = session->aggregatedPayloadEntries();
  ASSERT_EQ(entries.size(), 1u);
  EXPECT_EQ(entries[0],
            (SXValue{{"Playback_Start_3", {{"peak_level", 1}, {"route", "a b"}, {"a_b", 2}}}}));
  t.drain();
  EXPECT_EQ(t.fern->payloads(), std::vector<SXValue>{entries[0]["Playback_Start_3"]});
  EXPECT_EQ(session->createSummaryEventForSession(),
            (SXValue{{"SX_Session_Summary_Event", "7"},
                     {"Playback_Start_3", R"({"a_b":2,"peak_level":1,"route":"a b"})"}}));
  // Not an internal build: no file, but the configuration now heads the aggregate.
  EXPECT_TRUE(t.fileSystem->files.empty());
  EXPECT_EQ(session->aggregatedPayloadEntries()[0], SXValue::object());
  // The stored text is written straight from the packed payload: same members, same order as
  // the rewritten dictionary's, which can still be had once only the text is kept.
  for (const SXValue& spaced :
       {payload, SXValue{{"a b", 1}, {"a_a", {{"x y", 2}}}, {"a!", 3}}, SXValue::array({1}),
        SXValue{{"z", "\",{} \\"}, {"a b", {1.5, "]", nullptr}}, {"a_b", 2}, {"a c", -0.0}},
        SXValue{{"\xc3\xa9 t", 1}, {"e t", 2}}, SXValue{{"q\"u o", 1}, {"b", 2}},
        SXValue{{"a key of more than sixteen bytes", 1},
                {"a_key_of_more_than_sixteen bytes", 2},
                {"sixteen  bytes k", 3}},
        SXValue::object()}) {
    const SXValue rewritten = SXReportingSessionUnderscoreKeys(spaced);
    SXReportingMessagePayload prepared(
        std::make_shared<const SXPackedValue>(SXPackedValue::fromValue(spaced)));
    EXPECT_EQ(prepared.rewritten(), rewritten) << spaced.dump();
    EXPECT_EQ(*prepared.text(), SXValueText(rewritten)) << spaced.dump();
    EXPECT_EQ(prepared.rewritten(), rewritten) << spaced.dump();
  }
}

TEST(SXReportingSessionMessages, StandaloneDelayOnlyForAlarmsAndFailureReachesTheReply) {
  TestEnvironment t;
  makeSession(t);  // registers the session scope, whose verbose lines we read
  for (SXReportingServiceType type : {0, 2, 5, 65535, 4}) {
    SXReportingSession::sendSingleMessage(t.environment, SXValue::object(), 1, 1, type, nullptr,
                                          nullptr);
  }
  using std::chrono::seconds;
  EXPECT_EQ(t.dispatch->delays(),
            (std::vector<std::chrono::nanoseconds>{seconds(0), seconds(0), seconds(0), seconds(0),
                                                   seconds(59)}));

  SXSystemRandom random;
  for (int i = 0; i < 2000; ++i) EXPECT_LT(random.uniform(60), 60u);

  // A spool whose directory is missing fails every store: the reply says so.
  SXPlatform platform = t.platform();
  platform.fernReporting =
      std::make_shared<SXSqliteFernReporting>(t.directory + "/absent/fern.db", "", nullptr);
  std::optional<FernError> got;
  SXReportingSession::sendSingleMessage(t.makeEnvironment({}, platform), SXValue::object(), 1, 1, 2,
                                        nullptr, [&](std::optional<FernError> e) { got = e; });
  t.drain();
  ASSERT_TRUE(got);
  EXPECT_TRUE(got->localizedDescription.starts_with("cannot store the message"))
      << got->localizedDescription;
}

TEST(SXReportingSessionMessages, SendsQueuedTogetherKeepTheirPlaceAroundStartAndStop) {
  TestEnvironment t;
  auto session = makeSession(t, 42, 2);
  // Nothing runs on the session's queue until drain(): every task below waits there together.
  session->sendMessage({{"n", 0}}, 3, 1, nullptr);  // not started: standalone
  session->start();
  bool completed = false;
  session->setTransactionCompleteBlock([&](bool ok) { completed = ok; });
  session->sendMessage({{"n", 1}}, 3, 1, nullptr);
  session->start();  // a second start keeps everything
  session->sendMessage({{"n 2", 2}}, 3, 1, nullptr);
  EXPECT_EQ(session->aggregatedPayloadEntries().size(), 2u);
  session->stop();  // before the setup task ran
  EXPECT_TRUE(completed);
  EXPECT_FALSE(session->aggregatedPayloadData());
  session->sendMessage({{"n", 3}}, 3, 1, nullptr);  // stopped: standalone
  session->start();
  session->sendMessage({{"n", 4}}, 3, 1, nullptr);
  // Numbering goes on through the restart: the fifth message of its kind.
  EXPECT_TRUE(session->aggregatedPayloadEntries()[0].contains("Playback_Start_5"));
  session->stop();
  auto testSession = makeSession(t, 43, 11);  // test sessions never talk to the server
  testSession->start();
  testSession->sendMessage({{"k", 1}}, 3, 1, nullptr);
  testSession->stop();
  // Each run of a started session's sends waits for more to gather (n 1 and n 2, n 4, k 1);
  // the standalone ones do not.
  EXPECT_EQ(t.dispatch->delays(),
            std::vector<std::chrono::nanoseconds>(3, std::chrono::milliseconds(5)));
  t.drain();

  // Each run of messages reached the session that was open when it was accepted, in order,
  // its summary last, and each session's flush follows its own messages.
  EXPECT_EQ(t.fern->payloads("session_id IS NULL"), (std::vector<SXValue>{{{"n", 0}}, {{"n", 3}}}));
  auto first = t.fern->payloads("session_id = 1");
  ASSERT_EQ(first.size(), 3u);
  EXPECT_EQ(first[1], (SXValue{{"n_2", 2}}));
  EXPECT_TRUE(first[2].contains("SX_Session_Summary_Event"));
  auto second = t.fern->payloads("session_id = 2");
  ASSERT_EQ(second.size(), 2u);
  EXPECT_EQ(second[0], (SXValue{{"n", 4}}));
  EXPECT_EQ(t.fern->count("flushes f JOIN messages m ON m.session_id = f.session_id "
                          "WHERE m.time > f.time"),
            0);
  EXPECT_EQ(t.fern->count("flushes"), 2);
  ASSERT_EQ(t.fern->count("sessions WHERE token IS NOT NULL"), 2);
  EXPECT_FALSE(testSession->fernReportingAgentToken());
  auto opened = t.fern->rows("SELECT session_info_json AS s, user_info_json AS u FROM sessions");
  EXPECT_EQ(SXValue::parse(opened[0]["s"].get<std::string>())[fern::kSessionInfoSessionID], 42);
  SXValue user = SXValue::parse(opened[0]["u"].get<std::string>());
  EXPECT_EQ(user[fern::kUserInfoServiceName], "telephony_session");
  // Defaults fill what the configuration leaves out.
  SXValue config = {{"a", 1}};
  SXValue defaults = {{"a", 2}, {"b", 3}};
  session->setConfiguration(&config);
  session->updateDefaults(&defaults);
  session->setConfiguration(nullptr);
  EXPECT_EQ(session->userInfo(), defaults);
}

TEST(SXReportingSessionOrientation, WhoTracksAndTheRoundedTimesInTheSummary) {
  struct Case {
    SXValue device;
    SXReportingServiceType type;
    bool tracks;
  };
  for (const auto& c :
       {Case{internalBuild(), 2, true}, Case{internalBuild(), 7, true},
        Case{internalBuild(), 1, false}, Case{internalBuild(6), 2, false},
        Case{{{"InternalBuild", true}}, 7, true}, Case{SXValue::object(), 2, false},
        // Only a true boolean makes an internal build.
        Case{{{"InternalBuild", 1}}, 7, false}, Case{{{"InternalBuild", "YES"}}, 7, false}}) {
    TestEnvironment t(c.device);
    auto session = makeSession(t, 42, c.type);
    SCOPED_TRACE(c.device.dump() + " type " + std::to_string(c.type));
    const std::string id = "SXReportingService 42";
    session->start();
    EXPECT_EQ(session->startDate().has_value(), c.tracks);
    // Changes come from other threads; their times are rounded into the summary.
    t.clock->advance(0.0005);
    std::thread([&] { EXPECT_EQ(t.orientation->fireDevice(id, 1), c.tracks); }).join();
    t.clock->advance(1.23456 - 0.0005);
    std::thread([&] { EXPECT_EQ(t.orientation->fireDevice(id, 3), c.tracks); }).join();
    t.clock->advance(12.0004 - 1.23456);
    std::thread([&] { EXPECT_EQ(t.orientation->fireInterface(id, 4), c.tracks); }).join();
    std::thread([&] { EXPECT_EQ(t.orientation->fireDevice(id, 2), c.tracks); }).join();
    auto event = session->createSummaryEventForSession();
    ASSERT_EQ(event.has_value(), c.tracks);
    if (c.tracks) {
      EXPECT_EQ((*event)["device_orientation"], "orientation1,orientation3,orientation2");
      EXPECT_EQ((*event)["device_orientation_time"], "0.001,1.235,12");
      EXPECT_EQ((*event)["ui_orientation"], "orientation4");
      EXPECT_EQ((*event)["ui_orientation_time"], "12");
    }
    session->stop();
    EXPECT_FALSE(t.orientation->fireInterface(id, 1));  // removed at stop
  }
}

TEST(SXReportingSessionLifecycle, SessionsWaitingForBackendsNeverHoldUpAnother) {
  TestEnvironment t;
  auto dispatch = std::make_shared<SXAsioDispatch>();  // real queues, pool and timers
  SXPlatform platform = t.platform();
  platform.dispatch = dispatch;
  auto environment = std::make_shared<SXReportingEnvironment>(platform);
  environment->setBackendWaitSeconds(30);
  t.fern->holdConfigurations(true);
  // Polls the spool until `from` holds `rows` rows.
  auto eventually = [&](const std::string& from, int64_t rows) {
    return waitUntil([&] { return t.fern->count(from) == rows; }, std::chrono::seconds(10));
  };

  // More sessions wait at once than the pool has threads.
  constexpr int kWaiting = 400;
  std::vector<std::shared_ptr<SXReportingSession>> sessions;
  for (int id = 1; id <= kWaiting; ++id) {
    sessions.push_back(SXReportingSession::initWithID(environment, id, SXValue::array()));
    sessions.back()->start();
    sessions.back()->sendMessage({{"k", id}}, 3, 1, nullptr);
  }
  ASSERT_TRUE(t.log->waitFor("waiting for fernreportingd to find backends", kWaiting));

  // One more, whose backends come at once: its send and its stop's flush go through while
  // every other session still waits.
  t.fern->holdConfigurations(false);
  auto last = SXReportingSession::initWithID(environment, kWaiting + 1, SXValue::array());
  last->start();
  last->sendMessage({{"k", 0}}, 3, 1, nullptr);
  last->stop();
  const std::string others =
      "messages WHERE session_id NOT IN (SELECT id FROM sessions WHERE "
      "json_extract(session_info_json, '$.SessionID') = 401)";
  EXPECT_TRUE(eventually("flushes", 1));
  EXPECT_EQ(t.fern->count("messages"), 2);  // its message and its summary
  EXPECT_EQ(t.fern->count(others), 0);

  // The waits end with their backends; what waited behind them follows.
  t.fern->deliverHeld();
  EXPECT_TRUE(eventually(others, kWaiting));
  for (auto& session : sessions) session->stop();
  EXPECT_TRUE(eventually("flushes", kWaiting + 1));
  EXPECT_EQ(t.log->count("continuing"), size_t(kWaiting));
  EXPECT_EQ(t.log->count("failed to find backend"), 0u);
}

TEST(SummaryFileName, TheHostNameStandsAsItIsButCannotEscapeOrOverrunOrCollide) {
  // "20261116-185803+0000-sonex-" and "-longformaudio.json": 46 bytes besides the host.
  const std::string kept[] = {
      "player", "com.vendra.Music",   "caf\u00e9 app",      "", ".hidden", "...",
      "a\\b",   "tab\there\nnew\x7f", std::string(209, 'a')};
  for (const std::string& name : kept) EXPECT_EQ(hostPart(name), name);
  EXPECT_EQ(hostPart("../../etc/passwd"), ".._.._etc_passwd");
  EXPECT_EQ(hostPart(std::string("nul\0x", 5)), "nul_x");
  EXPECT_EQ(hostPart(std::string(300, 'a')), std::string(209, 'a'));
  // Two-byte characters: the cut keeps 104 of them whole rather than split the 105th.
  std::string accents;
  for (int i = 0; i < 120; ++i) accents += "\u00e9";
  EXPECT_EQ(hostPart(accents), accents.substr(0, 208));

  // Sessions stopping in the same second keep their own files.
  EXPECT_EQ(summaryNames("player", {1, 2, 3}),
            (std::vector<std::string>{"player-longformaudio-2.json", "player-longformaudio-3.json",
                                      "player-longformaudio.json"}));
}
