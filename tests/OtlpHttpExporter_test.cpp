#include "export/OtlpHttpExporter.h"

#include <google/protobuf/util/json_util.h>
#include <gtest/gtest.h>

#include <cmath>
#include <fstream>

#include "fakes/FakeClock.h"
#include "fakes/FakeHttpPost.h"
#include "fakes/FakeLog.h"
#include "opentelemetry/proto/common/v1/common.pb.h"
#include "sqlite/SqliteFernReporting.h"
#include "support/Daemon.h"
#include "support/OtlpReceiver.h"
#include "support/SqliteTestSupport.h"
#include "support/TestEnvironment.h"

using namespace std::chrono_literals;
using Outcome = SXOtlpHttpExporter::Outcome;

namespace {

class OtlpHttpExporterTest : public ::testing::Test {
 protected:
  OtlpHttpExporterTest() {
    options_.endpoint = "http://collector.test:4318/v1/logs";
    options_.batchSize = 2;
    options_.interval = 10ms;
    options_.initialBackoff = 100ms;
    options_.maxBackoff = 1000ms;
    options_.resource.hostName = "box";
    options_.gzip = false;  // bodies the fake can parse
  }

  std::unique_ptr<SXOtlpHttpExporter> Make(uint32_t random = 0) {
    return std::make_unique<SXOtlpHttpExporter>(db_, options_, http_, clock_,
                                                std::make_shared<FixedRandom>(random), log_);
  }
  // A standalone message, stored as the daemon stores it.
  void Standalone(const SXValue& payload) {
    std::optional<FernError> error;
    ASSERT_TRUE(spool_.sendOneMessage({{fern::kSessionInfoSessionID, -1}},
                                      {{fern::kUserInfoServiceName, "standalone"}}, 3, 1, payload,
                                      error));
  }
  int64_t DurableCursor() {
    // The exporter makes its table when it first commits a cursor.
    if (SXTestQuery(db_, "SELECT 1 FROM sqlite_master WHERE name = 'otlp_export'").empty()) {
      return 0;
    }
    auto rows = SXTestQuery(db_, "SELECT last_message_id FROM otlp_export");
    return rows.empty() ? 0 : rows[0]["last_message_id"].get<int64_t>();
  }
  // The sxr.message.id of every record of a request's JSON body.
  static std::vector<int64_t> Ids(const SXHttpRequest& request) {
    std::vector<int64_t> ids;
    SXValue body = SXValue::parse(request.body);
    for (const SXValue& record : body["resourceLogs"][0]["scopeLogs"][0]["logRecords"]) {
      ids.push_back(std::stoll(record["attributes"][0]["value"]["intValue"].get<std::string>()));
    }
    return ids;
  }
  std::vector<int64_t> LastIds() { return Ids(http_->requests().back()); }

  SXTestTempDir dir_;
  std::string db_ = dir_.file("fernreporting.db");
  std::shared_ptr<FakeLog> log_ = std::make_shared<FakeLog>();
  SXSqliteFernReporting spool_{db_, dir_.file("none.json"), log_};
  std::shared_ptr<FakeHttpPost> http_ = std::make_shared<FakeHttpPost>();
  std::shared_ptr<FakeClock> clock_ = std::make_shared<FakeClock>();
  SXOtlpExportOptions options_;
};

}  // namespace

// (Whole protobuf requests are read by the collector of OtlpExportEndToEnd.FailingCollector...)
TEST(OtlpLogsBody, ValuesMapAsTheProtobufJsonMappingWritesThem) {
  const double inf = std::numeric_limits<double>::infinity();
  struct Row {
    SXValue value;
    SXValue any;
  } rows[] = {
      {"text", {{"stringValue", "text"}}},
      {true, {{"boolValue", true}}},
      {-7, {{"intValue", "-7"}}},
      {uint64_t(1) << 63, {{"stringValue", "9223372036854775808"}}},  // digits over kind
      {1.5, {{"doubleValue", 1.5}}},
      {std::nan(""), {{"doubleValue", "NaN"}}},
      {inf, {{"doubleValue", "Infinity"}}},
      {SXValue::binary({0xde, 0xad, 0xbe, 0xef}), {{"bytesValue", "3q2+7w=="}}},
      // A binary value as a JSON store gives it back.
      {SXValue::parse(R"({"bytes": [104, 105, 33], "subtype": null})"), {{"bytesValue", "aGkh"}}},
      {SXValue::parse(R"({"bytes": [1, 300], "subtype": null})"),  // not bytes: a dictionary
       SXValue::parse(R"({"kvlistValue": {"values": [
           {"key": "bytes", "value": {"arrayValue": {"values": [{"intValue": "1"},
                                                                {"intValue": "300"}]}}},
           {"key": "subtype", "value": {}}]}})")},
      {nullptr, SXValue::object()},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.value.dump(-1, ' ', false, SXValue::error_handler_t::replace));
    EXPECT_EQ(SXOtlpAnyValue(row.value), row.any);
    // The protobuf encoding is converted from this JSON: protobuf must read it as written.
    opentelemetry::proto::common::v1::AnyValue any;
    EXPECT_TRUE(google::protobuf::util::JsonStringToMessage(row.any.dump(), &any).ok());
  }
}

TEST_F(OtlpHttpExporterTest, BatchesInIdOrderUpToTheirBoundsAndMoveTheDurableCursor) {
  for (int i = 1; i <= 5; ++i) Standalone({{"i", i}});
  auto exporter = Make();
  std::vector<std::vector<int64_t>> batches;
  std::vector<std::chrono::milliseconds> delays;
  for (int pass = 0; pass < 3; ++pass) {
    auto done = exporter->exportOnce();
    EXPECT_EQ(done.outcome, Outcome::kExported);
    batches.push_back(LastIds());
    delays.push_back(exporter->delayAfter(done));
  }
  EXPECT_EQ(batches, (std::vector<std::vector<int64_t>>{{1, 2}, {3, 4}, {5}}));
  // Full batches go on at once; a short one means the backlog is drained.
  EXPECT_EQ(delays, (std::vector<std::chrono::milliseconds>{0ms, 0ms, 10ms}));
  EXPECT_EQ(DurableCursor(), 5);
  EXPECT_EQ(exporter->backlog(), 0u);
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kIdle);
  // (A restarted exporter starts after the cursor: OtlpExportEndToEnd.FailingCollectorAnd...)

  // Large payloads cut the batch short; one too large alone goes alone.
  options_.batchSize = 10;
  options_.maxBatchBytes = 250;
  Standalone({{"s", std::string(400, 'x')}});
  for (int i = 0; i < 3; ++i) Standalone({{"s", std::string(100, 'y')}});
  exporter = Make();
  batches.clear();
  while (exporter->exportOnce().outcome == Outcome::kExported) batches.push_back(LastIds());
  EXPECT_EQ(batches, (std::vector<std::vector<int64_t>>{{6}, {7, 8}, {9}}));
}

TEST_F(OtlpHttpExporterTest, CursorMovesOnlyAfterA2xxAndFailuresBackOff) {
  Standalone({{"i", 1}});
  http_->fail("Connection refused");
  for (int status : {503, 429, 404, 500}) http_->answer(status);
  auto exporter = Make(UINT32_MAX);  // the largest jitter: the whole back-off
  std::vector<std::chrono::milliseconds> delays;
  for (int attempt = 0; attempt < 5; ++attempt) {
    auto pass = exporter->exportOnce();
    EXPECT_EQ(pass.outcome, Outcome::kFailed);
    delays.push_back(exporter->delayAfter(pass));
    EXPECT_EQ(DurableCursor(), 0);
    EXPECT_EQ(exporter->backlog(), 1u);
  }
  // Doubled from 100 ms up to the cap (FixedRandom(0) halves it: RetryAfterOn429And503...).
  EXPECT_EQ(delays, (std::vector<std::chrono::milliseconds>{100ms, 200ms, 400ms, 800ms, 1000ms}));
  // One error line for the whole streak, naming the first cause.
  ASSERT_EQ(log_->lines().size(), 1u);
  EXPECT_EQ(log_->lines()[0].level, SXLogLevel::kError);
  EXPECT_TRUE(log_->contains("Connection refused"));

  Standalone({{"i", 2}});
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kExported);
  for (const auto& request : http_->requests()) EXPECT_EQ(Ids(request)[0], 1);  // the same batch
  EXPECT_EQ(LastIds(), (std::vector<int64_t>{1, 2}));
  EXPECT_EQ(DurableCursor(), 2);
  EXPECT_TRUE(
      log_->contains("exporting to http://collector.test:4318/v1/logs again after 5 "
                     "failed attempts"));
}

TEST_F(OtlpHttpExporterTest, RetryAfterOn429And503WaitsAtLeastThatLong) {
  Standalone({{"i", 1}});
  // FixedRandom(0): the back-off of a first failure is 50 ms; the clock says 08:00:00.
  struct Row {
    int status;
    std::string retryAfter;
    std::chrono::milliseconds delay;
  } rows[] = {
      {429, "2", 2000ms},
      {503, "Fri, 15 Jan 2027 08:00:03 GMT", 3000ms},
      {503, "Friday, 15-Jan-27 08:00:04 GMT", 4000ms},
      {429, "Fri Jan 15 08:00:01 2027", 1000ms},
      {429, "Fri, 15 Jan 2027 07:43:20 GMT", 50ms},  // past: the back-off
      {429, "0", 50ms},                              // never shorter than the back-off
      {503, "86400", 300000ms},                      // capped at 5 minutes
      {429, "soon", 50ms},
      {500, "2", 50ms},  // only 429 and 503 carry a wait
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.retryAfter);
    http_->answer(row.status, "", {{"retry-after", row.retryAfter}});
    auto exporter = Make();
    EXPECT_EQ(exporter->delayAfter(exporter->exportOnce()), row.delay);
  }
}

TEST_F(OtlpHttpExporterTest, TimeoutsHalveTheBatchAndLengthenTheTimeUntilDrained) {
  options_.batchSize = 8;
  options_.timeout = 100ms;
  for (int i = 1; i <= 9; ++i) Standalone({{"i", i}});
  for (int i = 0; i < 5; ++i) http_->timeOut();
  auto exporter = Make();
  while (exporter->exportOnce().outcome != Outcome::kIdle) {
  }
  std::vector<size_t> records;
  std::vector<int64_t> timeouts;  // in ms
  for (const SXHttpRequest& request : http_->requests()) {
    records.push_back(Ids(request).size());
    timeouts.push_back(request.timeout.count());
  }
  // Halved down to one message and doubled up to 8 times the timeout; then the batch grows
  // back by doubling after each 2xx while the longer timeout stays for the backlog.
  EXPECT_EQ(records, (std::vector<size_t>{8, 4, 2, 1, 1, 1, 2, 4, 2}));
  EXPECT_EQ(timeouts, (std::vector<int64_t>{100, 200, 400, 800, 800, 800, 800, 800, 800}));
  // Drained: the next backlog starts with the configured timeout again.
  Standalone({{"i", 10}});
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kExported);
  EXPECT_EQ(http_->requests().back().timeout, 100ms);
}

TEST_F(OtlpHttpExporterTest, RejectedBatchesAreDroppedAndOversizedOnesHalved) {
  for (int i = 1; i <= 5; ++i) Standalone({{"i", i}});
  options_.batchSize = 4;
  http_->answer(413);
  http_->answer(200);
  http_->answer(400, "bad\nfield");
  auto exporter = Make();

  auto pass = exporter->exportOnce();
  EXPECT_EQ(pass.outcome, Outcome::kShrunk);
  EXPECT_EQ(exporter->delayAfter(pass), 0ms);
  EXPECT_EQ(DurableCursor(), 0);
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kExported);
  EXPECT_EQ(LastIds(), (std::vector<int64_t>{1, 2}));

  // Batches stay halved while the backlog lasts; a 400 drops the batch for good.
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kDropped);
  EXPECT_EQ(LastIds(), (std::vector<int64_t>{3, 4}));
  EXPECT_EQ(DurableCursor(), 4);
  EXPECT_TRUE(
      log_->contains("dropping messages 3 to 4: the collector rejected them with 400 "
                     "bad field"));
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kExported);
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kIdle);

  // A single message still too large is dropped too.
  Standalone({{"i", 6}});
  http_->answer(413);
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kDropped);
  EXPECT_EQ(DurableCursor(), 6);

  // Once drained, whole batches again; a partial success is logged and the cursor moves.
  for (int i = 7; i <= 10; ++i) Standalone({{"i", i}});
  http_->answer(200, R"({"partialSuccess": {"rejectedLogRecords": "1", "errorMessage": "x"}})");
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kExported);
  EXPECT_EQ(LastIds(), (std::vector<int64_t>{7, 8, 9, 10}));
  EXPECT_TRUE(log_->contains("the collector rejected 1 of messages 7 to 10: x"));
  EXPECT_EQ(DurableCursor(), 10);
}

TEST_F(OtlpHttpExporterTest, ASpoolThatCannotBeOpenedIsAFailedAttempt) {
  db_ = dir_.file("missing/dir/spool.db");
  auto exporter = Make();
  EXPECT_EQ(exporter->exportOnce().outcome, Outcome::kFailed);
  EXPECT_EQ(exporter->backlog(), 0u);
  EXPECT_TRUE(http_->requests().empty());
  EXPECT_TRUE(log_->contains("cannot read the spool"));
}

TEST_F(OtlpHttpExporterTest, ThreadExportsUntilStoppedAndStopCancelsThePost) {
  auto exporter = Make();
  exporter->start();
  for (int i = 1; i <= 5; ++i) Standalone({{"i", i}});
  // The table exists once the thread has posted; the cursor follows the last 2xx.
  ASSERT_TRUE(waitUntil([&] { return !http_->requests().empty() && LastIds().back() == 5; }));
  EXPECT_TRUE(waitUntil([&] { return DurableCursor() == 5; }));
  exporter->stop();
  EXPECT_TRUE(http_->cancelled());
  EXPECT_GE(http_->requests().size(), 3u);
}

// Good values of every key, headers included, are read through the daemon (OtlpExportEndToEnd).
TEST(OtlpExportOptions, EnvironmentFillsWhatTheFileLeavesOutAndBadValuesAreRefused) {
  using Options = SXOtlpExportOptions;
  struct Row {
    const char* file;
    SXEnvironment environment;
    const char* error;  // how the refusal starts; "" when accepted
    std::function<void(const Options&)> check = [](const Options&) {};
  } rows[] = {
      // The generic endpoint gets the signal's path.
      {"{}",
       {{"OTEL_EXPORTER_OTLP_ENDPOINT", "http://c:4318/"},
        {"OTEL_EXPORTER_OTLP_PROTOCOL", "http/protobuf"},
        {"OTEL_EXPORTER_OTLP_COMPRESSION", "none"}},
       "",
       [](const Options& o) {
         EXPECT_EQ(o.endpoint, "http://c:4318/v1/logs");
         EXPECT_EQ(o.encoding, Options::Encoding::kProtobuf);
         EXPECT_FALSE(o.gzip);
       }},
      // The signal's own variable is used as is and wins over the generic one.
      {"{}",
       {{"OTEL_EXPORTER_OTLP_ENDPOINT", "http://c:4318"},
        {"OTEL_EXPORTER_OTLP_LOGS_ENDPOINT", "https://d/logs"},
        {"OTEL_EXPORTER_OTLP_TIMEOUT", "900"},
        {"OTEL_EXPORTER_OTLP_LOGS_TIMEOUT", "250"}},
       "",
       [](const Options& o) {
         EXPECT_EQ(o.endpoint, "https://d/logs");
         EXPECT_EQ(o.timeout, 250ms);
       }},
      // What the file says wins, per key and per attribute name.
      {R"({"endpoint": "http://file/v1/logs", "resourceAttributes": {"deployment.environment": "prod"}})",
       {{"OTEL_EXPORTER_OTLP_ENDPOINT", "http://env"},
        {"OTEL_RESOURCE_ATTRIBUTES", "deployment.environment=lab,service.name=a,team=x"},
        {"OTEL_SERVICE_NAME", "b"}},
       "",
       [](const Options& o) {
         EXPECT_EQ(o.endpoint, "http://file/v1/logs");
         EXPECT_EQ(o.resource.attributes,
                   (std::map<std::string, std::string>{
                       {"deployment.environment", "prod"}, {"service.name", "b"}, {"team", "x"}}));
       }},
      {"[]", {}, "must be an object"},
      {R"({"endpoint": "ftp://x"})", {}, "\"endpoint\" must be an http"},
      {R"({"batchSize": "5"})", {}, "\"batchSize\" must be a whole number"},
      {R"({"intervalMs": -1})", {}, "\"intervalMs\" must be a whole number"},
      {R"({"batchsize": 5})", {}, "unknown key \"batchsize\""},
      {R"({"headers": {"A": "x\ny"}})", {}, "\"headers\": \"A\" must be a name with a one-line"},
      {R"({"initialBackoffMs": 500, "maxBackoffMs": 100})", {}, "\"maxBackoffMs\" must not be"},
      {"{}", {{"OTEL_EXPORTER_OTLP_TIMEOUT", "1s"}}, "environment: OTEL_EXPORTER_OTLP_TIMEOUT"},
      {"{}", {{"OTEL_EXPORTER_OTLP_ENDPOINT", "c:4318"}}, "environment: \"endpoint\""},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.file + testing::PrintToString(row.environment));
    auto options = Options::fromSources(SXValue::parse(row.file), row.environment);
    EXPECT_EQ(options.ok(), !*row.error) << options.error();
    if (options.ok()) {
      row.check(*options);
    } else {
      EXPECT_TRUE(options.error().starts_with(row.error)) << options.error();
    }
  }
}

TEST(OtlpExportOptions, ABadSectionIsLoggedAndExportsNothing) {
  // A good one, listed or not, is read through the daemon (OtlpExportEndToEnd).
  SXTestTempDir dir;
  std::string path = dir.file("fernreporting.json");
  FakeLog log;
  std::ofstream(path) << R"({"backends": ["otlp-http"], "otlp-http": {"batchSize": 0}})";
  EXPECT_FALSE(SXOtlpExportOptions::load(path, {"otlp-http"}, log));
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_TRUE(log.contains("\"batchSize\" must be a whole number from 1"));
  EXPECT_TRUE(log.contains("not exporting (messages stay in the spool)"));
}

TEST(CurlHttpPost, ReportsStatusesAndFailuresWithoutAResponse) {
  OtlpReceiver receiver;
  SXCurlHttpPost http;
  SXHttpRequest request{receiver.endpoint(), {{"X-Key", "v"}}, std::string(5000, 'b'), 5s};
  SXHttpResult ok = http.post(request);
  EXPECT_EQ(ok.status, 200) << ok.error;
  EXPECT_EQ(ok.body, "{}");
  auto seen = receiver.requests().at(0);
  EXPECT_EQ(seen.body.size(), 5000u);
  EXPECT_EQ(seen.headers["x-key"], "v");
  EXPECT_EQ(seen.headers.count("expect"), 0u);  // no 100-continue round trip

  receiver.failNext(1, 503, "7");
  SXHttpResult unavailable = http.post(request);
  EXPECT_EQ(unavailable.status, 503);
  EXPECT_EQ(unavailable.headers["retry-after"], "7");

  receiver.dropNext(2);  // a kept-alive connection that dies unanswered is tried once more
  SXHttpResult dropped = http.post(request);
  EXPECT_FALSE(dropped.status);
  EXPECT_FALSE(dropped.timedOut);

  receiver.answerAfter(2s);
  request.timeout = 100ms;
  SXHttpResult late = http.post(request);
  EXPECT_FALSE(late.status);
  EXPECT_TRUE(late.timedOut);

  http.cancel();
  SXHttpResult cancelled = http.post(request);
  EXPECT_FALSE(cancelled.status);
  EXPECT_EQ(cancelled.error, "cancelled");
}
