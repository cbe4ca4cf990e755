// Back-pressure through the real daemon: a client that pipelines far more than a connection
// may queue, and a client that stops reading its replies, get every reply in order, and the
// daemon's memory stays bounded meanwhile.
#include <gtest/gtest.h>

#include <atomic>
#include <numeric>
#include <thread>

#include "support/Daemon.h"
#include "support/RawSocket.h"

namespace {

using namespace std::chrono_literals;

// A raw connection whose writer thread pipelines `count` requests `params(i)` of `method`,
// 16 KiB at a time, while the test reads.
class Pipeline {
 public:
  Pipeline(const TestDaemon& daemon, int count, std::string_view method,
           std::function<SXValue(int)> params)
      : raw_(daemon.socket()), count_(count) {
    writer_ = std::thread([this, method, params] {
      msgpack::sbuffer out;
      for (int i = 0; i < count_; ++i) {
        RpcEncodeRequest(out, static_cast<uint32_t>(i), method, params(i));
        if (out.size() < 16 * 1024 && i + 1 < count_) continue;
        if (raw_.send({out.data(), out.size()}, &written) < out.size()) return;
        out.clear();
      }
    });
  }
  ~Pipeline() { writer_.join(); }

  // Every reply has come, in the order of the requests.
  void expectEveryReplyInOrder(const TestDaemon& daemon) {
    std::vector<int64_t> ids = raw_.responses(static_cast<size_t>(count_));
    std::vector<int64_t> expected(static_cast<size_t>(count_));
    std::iota(expected.begin(), expected.end(), 0);
    const std::string log = daemon.log();
    EXPECT_EQ(ids, expected) << "the daemon's log ends:\n"
                             << log.substr(log.size() > 4000 ? log.size() - 4000 : 0);
  }

  std::atomic<size_t> written{0};

 private:
  SXTestRawClient raw_;
  const int count_;
  std::thread writer_;
};

}  // namespace

TEST(BackpressureEndToEnd, PipelinedFarBeyondTheQueueLimitEveryReplyComesInOrder) {
  TestDaemon daemon({.extraArgs = {"--max-queued-requests", "32"}});
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(7)));

  // Far beyond the limit of 32 either way; the sanitizers' daemon is several times slower.
  constexpr int kRequests = SXR_UNDER_ASAN ? 5'000 : 20'000;
  {
    Pipeline pipeline(daemon, kRequests, sxr::method::kSendMessage, [](int i) {
      return SXValue::array(
          {SXValue{{"index", i}, {"route name", "speaker"}}, 3, 1, SXValue::array({7})});
    });
    pipeline.expectEveryReplyInOrder(daemon);
  }
  // The connection was paused at its limit of queued requests, and lost nothing by it.
  EXPECT_GT(replied(client->status())["counters"]["guardrail_dropped"]["requests_backpressure"], 0);
  // Every message reached the session, in order. Only the messages' events: the connections'
  // uptime events land in the same table.
  auto rows = daemon.waitForRows(
      "tallyvane.db",
      "SELECT payload_json FROM events WHERE payload_json LIKE '%\"index\"%' ORDER BY id",
      kRequests);
  ASSERT_EQ(rows.size(), size_t{kRequests});
  EXPECT_EQ(SXValue::parse(rows.back()["payload_json"].get<std::string>())["index"], kRequests - 1);
}

TEST(BackpressureEndToEnd, AClientThatStopsReadingKeepsTheDaemonsMemoryBounded) {
  TestDaemon daemon({.extraArgs = {"--max-pending-reply-bytes", "1048576"}});
  auto client = daemon.client();
  // Many sessions make every getAllReporters reply a few KiB: 20,000 of them are ~90 MB.
  constexpr int kSessions = 500;
  for (int i = 0; i < kSessions; ++i) client->createReportingSession(1'000'000'000'000 + i);
  ASSERT_EQ(replied(client->getAllReporters()).size(), size_t{kSessions});
  int64_t before = residentKiB(daemon.pid());

  constexpr int kRequests = 20'000;
  Pipeline pipeline(daemon, kRequests, sxr::method::kGetAllReporters,
                    [](int) { return SXValue::array(); });
  // The daemon stops reading: the writer makes no progress for a while.
  size_t last = 0;
  ASSERT_TRUE(waitUntil(
      [&] {
        size_t now = pipeline.written.load();
        bool stalled = now > 0 && now == last;
        last = now;
        std::this_thread::sleep_for(300ms);
        return stalled && pipeline.written.load() == now;
      },
      60s));
  EXPECT_LT(pipeline.written.load(), size_t{kRequests} * 20);  // not everything could be sent
  // The sanitizer's quarantine keeps freed memory resident.
  if (!SXR_UNDER_ASAN) {
    EXPECT_LT(residentKiB(daemon.pid()) - before, 40 * 1024) << before;
  }
  pipeline.expectEveryReplyInOrder(daemon);
}
