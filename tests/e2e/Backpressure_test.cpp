// Back-pressure through the real daemon: a client that pipelines far more than a connection
// may queue, and a client that stops reading its replies, get every reply in order, and the
// daemon's memory stays bounded meanwhile.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "support/Daemon.h"
#include "support/RawSocket.h"

namespace {

using namespace std::chrono_literals;

TestDaemon::Options withArgs(std::vector<std::string> args) {
  TestDaemon::Options options;
  options.extraArgs = std::move(args);
  return options;
}

std::string logTail(const TestDaemon& daemon) {
  const std::string log = daemon.log();
  return log.substr(log.size() > 4000 ? log.size() - 4000 : 0);
}

bool underSanitizer() {
#if SXR_UNDER_ASAN
  return true;  // the sanitizer's quarantine keeps freed memory resident
#else
  return false;
#endif
}

}  // namespace

TEST(BackpressureEndToEnd, PipelinedFarBeyondTheQueueLimitEveryReplyComesInOrder) {
  TestDaemon daemon(withArgs({"--max-queued-requests", "32"}));
  auto client = daemon.client();
  ASSERT_TRUE(replied(client->createReportingSession(7)));

  // Far beyond the limit of 32 either way; the sanitizers' daemon is several times slower.
  constexpr int kRequests = SXR_UNDER_ASAN ? 5'000 : 20'000;
  int fd = SXTestConnect(daemon.socket());
  std::atomic<size_t> written{0};
  std::thread writer([&] {
    SXTestWriteRequests(
        fd, kRequests,
        [](msgpack::sbuffer& out, int i) {
          RpcEncodeRequest(out, static_cast<uint32_t>(i), sxr::method::kSendMessage,
                           SXValue::array({SXValue{{"index", i}, {"route name", "speaker"}}, 3, 1,
                                           SXValue::array({7})}));
        },
        &written);
  });
  const std::vector<int64_t> ids = SXTestReadResponseIds(fd, kRequests);
  EXPECT_EQ(ids.size(), size_t{kRequests}) << "the daemon's log ends:\n" << logTail(daemon);
  EXPECT_EQ(ids, SXTestIds(kRequests));
  writer.join();
  ::close(fd);
  // The connection was paused at its limit of queued requests, and lost nothing by it.
  EXPECT_GT(replied(client->status())["counters"]["guardrail_dropped"]["requests_backpressure"], 0);
  // Every message reached the session, in order.
  // Only the messages' events: the connections' uptime events land in the same table.
  auto rows = daemon.waitForRows(
      "tallyvane.db",
      "SELECT payload_json FROM events WHERE payload_json LIKE '%\"index\"%' ORDER BY id",
      kRequests);
  ASSERT_EQ(rows.size(), size_t{kRequests});
  EXPECT_EQ(SXValue::parse(rows.back()["payload_json"].get<std::string>())["index"], kRequests - 1);
}

TEST(BackpressureEndToEnd, AClientThatStopsReadingKeepsTheDaemonsMemoryBounded) {
  TestDaemon daemon(withArgs({"--max-pending-reply-bytes", "1048576"}));
  auto client = daemon.client();
  // Many sessions make every getAllReporters reply a few KiB: 20,000 of them are ~90 MB.
  constexpr int kSessions = 500;
  constexpr int64_t kFirstID = 1'000'000'000'000;
  for (int i = 0; i < kSessions; ++i) client->createReportingSession(kFirstID + i);
  ASSERT_EQ(replied(client->getAllReporters()).size(), size_t{kSessions});
  int64_t before = residentKiB(daemon.pid());

  constexpr int kRequests = 20'000;
  int fd = SXTestConnect(daemon.socket());
  std::atomic<size_t> written{0};
  std::thread writer([&] {
    SXTestWriteRequests(
        fd, kRequests,
        [](msgpack::sbuffer& out, int i) {
          RpcEncodeRequest(out, static_cast<uint32_t>(i), sxr::method::kGetAllReporters,
                           SXValue::array());
        },
        &written);
  });
  // The daemon stops reading: the writer makes no progress for a while.
  size_t last = 0;
  ASSERT_TRUE(waitUntil(
      [&] {
        size_t now = written.load();
        bool stalled = now > 0 && now == last;
        last = now;
        std::this_thread::sleep_for(300ms);
        return stalled && written.load() == now;
      },
      60s));
  EXPECT_LT(written.load(), size_t{kRequests} * 20);  // not everything could be sent
  int64_t paused = residentKiB(daemon.pid());
  if (!underSanitizer()) {
    EXPECT_LT(paused - before, 40 * 1024) << before << " KiB before";
  }

  const std::vector<int64_t> ids = SXTestReadResponseIds(fd, kRequests);
  EXPECT_EQ(ids.size(), size_t{kRequests}) << "the daemon's log ends:\n" << logTail(daemon);
  EXPECT_EQ(ids, SXTestIds(kRequests));
  writer.join();
  ::close(fd);
}
