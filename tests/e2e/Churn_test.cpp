// Many short-lived clients that each create, start and send, then vanish without a goodbye:
// half are separate processes killed with SIGKILL, half close their socket with replies still
// unread. Afterwards the daemon must hold nothing of them.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <fstream>

#include "support/Daemon.h"
#include "support/RawSocket.h"

namespace {

using namespace std::chrono_literals;

constexpr int kClients = 1000;
constexpr int kBatch = 50;  // clients alive at once: half processes, half raw sockets

// A client speaking the wire protocol itself, so that it can leave in the middle of things.
class RawClient {
 public:
  explicit RawClient(const std::string& path) : fd_(SXTestConnect(path)) {
    if (fd_ < 0) ADD_FAILURE() << "connect: " << std::strerror(errno);
  }
  ~RawClient() { ::close(fd_); }
  RawClient(const RawClient&) = delete;
  RawClient& operator=(const RawClient&) = delete;

  void request(std::string_view method, const SXValue& params) {
    std::string bytes = SXTestRequest(++msgid_, method, params);
    SXTestSend(fd_, bytes.data(), bytes.size());
  }
  // Reads until `count` responses have come; false when the connection ends or time runs out.
  bool awaitResponses(size_t count) {
    SXValue message;
    while (responses_ < count) {
      if (decoder_.next(message) == RpcStreamDecoder::Status::kMessage) {
        ++responses_;
        continue;
      }
      if (!readable(10s)) return false;
      char* space = decoder_.prepare(4096);
      ssize_t n = ::recv(fd_, space, 4096, 0);
      if (n <= 0) return false;
      decoder_.commit(static_cast<size_t>(n));
    }
    return true;
  }
  bool readable(std::chrono::milliseconds timeout) {
    pollfd p{fd_, POLLIN, 0};
    return ::poll(&p, 1, static_cast<int>(timeout.count())) == 1;
  }
  // Leaves with a reply unread, which the daemon's side sees as a reset connection.
  void abandon() {
    request("getAllReporters:", SXValue::array());
    readable(10s);
    ::close(std::exchange(fd_, -1));
  }

 private:
  int fd_;
  uint32_t msgid_ = 0;
  size_t responses_ = 0;
  RpcStreamDecoder decoder_;
};

size_t startedSessions(const SXValue& status) {
  size_t started = 0;
  for (const auto& client : status["clients"]) {
    for (const auto& session : client["sessions"]) started += session["started"] == true;
  }
  return started;
}

// One batch: processes that sit in their start until killed, and raw clients that hang up.
void churnBatch(const TestDaemon& daemon, SXReportingClient& observer, int64_t firstID) {
  std::vector<pid_t> children;
  std::vector<std::unique_ptr<RawClient>> raws;
  for (int i = 0; i < kBatch; ++i) {
    std::string id = std::to_string(firstID + i);
    SXValue payload = {{"churn", firstID + i}};
    if (i % 2 == 0) {
      children.push_back(daemon.spawnCtl(
          {"create", id, "then", "send", "--ids", id, payload.dump(), "then", "start", id}));
      continue;
    }
    auto raw = std::make_unique<RawClient>(daemon.socket());
    raw->request("createReportingSession:reply:", {firstID + i});
    raw->request("startReportingSessionForID:reply:", {firstID + i});
    raw->request("sendMessage:withCategory:andType:forReportingIDs:reply:",
                 {payload, 3, 1, SXValue::array({firstID + i})});
    raws.push_back(std::move(raw));
  }
  for (auto& raw : raws) EXPECT_TRUE(raw->awaitResponses(2));  // the create and the send
  EXPECT_TRUE(waitUntil([&] { return startedSessions(replied(observer.status())) == kBatch; }, 30s))
      << "batch from " << firstID << " did not start";
  // The processes sent before their start; give every started session something to summarise.
  EXPECT_FALSE(replied(observer.sendMessage({{"batch", firstID}}, 3, 1, std::nullopt)));
  for (pid_t child : children) ::kill(child, SIGKILL);
  for (auto& raw : raws) raw->abandon();
  for (pid_t child : children) ::waitpid(child, nullptr, 0);
}

}  // namespace

TEST(ChurnEndToEnd, AThousandVanishingClientsLeaveNothingBehind) {
  TestDaemon daemon;
  auto observer = daemon.client();
  SXValue status = replied(observer->status());
  long baseline = residentKiB(daemon.pid());
  auto began = std::chrono::steady_clock::now();

  long peak = baseline;
  for (int64_t first = 1000; first < 1000 + kClients; first += kBatch) {
    churnBatch(daemon, *observer, first);
    peak = std::max(peak, residentKiB(daemon.pid()));
    if (HasFailure()) break;
  }
  ASSERT_TRUE(waitUntil(
      [&] {
        status = replied(observer->status());
        return status["gauges"]["clients_live"] == 1 && status["gauges"]["sessions_live"] == 0;
      },
      60s))
      << status.dump();
  double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
  long after = residentKiB(daemon.pid());

  ASSERT_EQ(status["clients"].size(), 1u);  // the observer, with no sessions
  EXPECT_TRUE(status["clients"][0]["sessions"].empty());
  EXPECT_TRUE(replied(observer->getAllReporters()).empty());
  EXPECT_EQ(status["counters"]["messages_received"], kClients + kClients / kBatch);
  EXPECT_EQ(daemon.countInLog("from the server client list"), 2u * kClients);  // removed, dealloc
  // The raw clients' unread replies make their ends resets, not clean closes.
  EXPECT_GE(daemon.countInLog("InterruptionHandler: connection exited"), kClients / 2u);
  // Every started session was stopped, so each sent its summary.
  EXPECT_EQ(daemon
                .waitForRows("fernreporting.db", "SELECT id FROM messages WHERE category = 65535",
                             kClients, 30s)
                .size(),
            static_cast<size_t>(kClients));
  // Each process's end is an uptime event with its name and how long it was connected.
  auto uptimes = daemon.waitForRows(
      "tallyvane.db",
      "SELECT payload_json FROM events WHERE name = 'com.vendra.sonex.sxreportingclientuptime' "
      "AND json_extract(payload_json, '$.processName') = 'sxreportctl'",
      kClients / 2, 30s);
  EXPECT_EQ(uptimes.size(), kClients / 2u);
  for (const auto& row : uptimes) {
    double lived = SXValue::parse(row["payload_json"].get<std::string>())["seconds"];
    EXPECT_TRUE(lived > 0 && lived < seconds + 1) << lived;
  }
  EXPECT_EQ(daemon.countInLog("InvalidationHandler: connection exited process=sxreportctl"),
            kClients / 2u);
  std::printf(
      "churn: %d clients in %.1f s; daemon RSS %ld KiB before, %ld KiB peak, %ld KiB after\n",
      kClients, seconds, baseline, peak, after);
  // Generous: allocator caches and the stores' page caches may keep some of the peak.
#if SXR_UNDER_ASAN
  const long allowance = 512 * 1024;  // the sanitizer's quarantine holds freed memory
#else
  const long allowance = 64 * 1024;
#endif
  EXPECT_LT(after, baseline + allowance);
}
