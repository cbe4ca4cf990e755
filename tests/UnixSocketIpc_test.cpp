// Back-pressure of the socket listener: a connection stops reading while too many of its
// requests wait to be handled, too many reply bytes wait to be written or the connections hold
// too many bytes together, loses nothing, and answers every request in order once it reads
// again; a request that never completes ends its connection.
#include "platform/UnixSocketIpc.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <thread>

#include "common/RpcCodec.h"
#include "common/SXThreadSafety.h"
#include "platform/AsioDispatch.h"
#include "support/SqliteTestSupport.h"

namespace {

using namespace std::chrono_literals;

bool waitFor(const std::function<bool()>& ready, std::chrono::milliseconds timeout = 15s) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!ready()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(2ms);
  }
  return true;
}

// Hands each request to a serial queue, whose first task waits until the test opens the gate,
// and replies there with the request's first param. Counts how many requests were handed on
// but not yet handled, at most.
class QueueingObject final : public SXIpcExportedObject {
 public:
  explicit QueueingObject(std::shared_ptr<SXWorkQueue> queue) : queue_(std::move(queue)) {
    queue_->async([this] {
      SXMutexLock lock(mutex_);
      lock.wait(gate_, [this]() SX_REQUIRES(mutex_) { return open_; });
    });
  }
  void handleRequest(std::string_view, SXValue params, size_t, SXIpcReplyFn reply) override {
    int64_t waiting = ++handedOn_ - handled_.load();
    maxWaiting_ = std::max(maxWaiting_.load(), waiting);
    queue_->async([this, value = params.at(0), reply = std::move(reply)] {
      ++handled_;
      reply(nullptr, value);
    });
  }
  void open() {
    {
      SXMutexLock lock(mutex_);
      open_ = true;
    }
    gate_.notify_all();
  }
  int64_t handedOn() const { return handedOn_; }
  int64_t maxWaiting() const { return maxWaiting_; }

 private:
  std::shared_ptr<SXWorkQueue> queue_;
  SXMutex mutex_;
  std::condition_variable gate_;
  bool open_ SX_GUARDED_BY(mutex_) = false;
  std::atomic<int64_t> handedOn_{0};
  std::atomic<int64_t> handled_{0};
  std::atomic<int64_t> maxWaiting_{0};
};

// Replies at once, on the I/O thread, with `replyBytes` bytes of text.
class BigReplyObject final : public SXIpcExportedObject {
 public:
  explicit BigReplyObject(size_t replyBytes) : text_(replyBytes, 'r') {}
  void handleRequest(std::string_view, SXValue params, size_t, SXIpcReplyFn reply) override {
    ++handedOn_;
    reply(nullptr, SXValue::array({params.at(0), text_}));
  }
  int64_t handedOn() const { return handedOn_; }

 private:
  const std::string text_;
  std::atomic<int64_t> handedOn_{0};
};

class ExportingDelegate final : public SXIpcListenerDelegate {
 public:
  explicit ExportingDelegate(std::shared_ptr<SXIpcExportedObject> object)
      : object_(std::move(object)) {}
  bool shouldAcceptNewConnection(const std::shared_ptr<SXIpcConnection>& connection) override {
    connection->setExportedObject(object_);
    connection->resume();
    return true;
  }

 private:
  std::shared_ptr<SXIpcExportedObject> object_;
};

// A listener serving on its own thread.
class ServedListener {
 public:
  ServedListener(SXUnixSocketListener::Options options, std::shared_ptr<SXIpcExportedObject> object)
      : path_(dir_.file("s")) {
    options.socketPath = path_;
    listener_ = std::make_unique<SXUnixSocketListener>(std::move(options), nullptr);
    std::string error;
    EXPECT_TRUE(listener_->open(error)) << error;
    listener_->setDelegate(std::make_shared<ExportingDelegate>(std::move(object)));
    thread_ = std::thread([this] { listener_->resume(); });
  }
  ~ServedListener() {
    listener_->stop();
    thread_.join();
  }
  const std::string& path() const { return path_; }
  SXUnixSocketListener& listener() { return *listener_; }

 private:
  SXTestTempDir dir_;
  std::string path_;
  std::unique_ptr<SXUnixSocketListener> listener_;
  std::thread thread_;
};

int connectTo(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
  EXPECT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  return fd;
}

// Writes `count` requests whose first param is their index, in chunks; blocks while the
// daemon does not read.
void writeRequests(int fd, int count) {
  msgpack::sbuffer out;
  for (int i = 0; i < count; ++i) {
    RpcEncodeRequest(out, static_cast<uint32_t>(i), "echo", SXValue::array({i}));
    if (out.size() > 16 * 1024 || i + 1 == count) {
      const char* data = out.data();
      size_t left = out.size();
      while (left > 0) {
        ssize_t n = ::write(fd, data, left);
        if (n <= 0) return;
        data += n;
        left -= static_cast<size_t>(n);
      }
      out.clear();
    }
  }
}

// Reads `count` responses; the msgids of the responses, in arrival order.
std::vector<int64_t> readResponses(int fd, int count) {
  RpcStreamDecoder decoder;
  std::vector<int64_t> ids;
  SXValue message;
  while (static_cast<int>(ids.size()) < count) {
    auto status = decoder.next(message);
    if (status == RpcStreamDecoder::Status::kMessage) {
      auto response = RpcParseResponse(message);
      ids.push_back(response ? int64_t(response->msgid) : -1);
      continue;
    }
    if (status == RpcStreamDecoder::Status::kBroken) break;
    char* buffer = decoder.prepare(64 * 1024);
    ssize_t n = ::read(fd, buffer, 64 * 1024);
    if (n <= 0) break;
    decoder.commit(static_cast<size_t>(n));
  }
  return ids;
}

std::vector<int64_t> range(int count) {
  std::vector<int64_t> ids(count);
  for (int i = 0; i < count; ++i) ids[i] = i;
  return ids;
}

}  // namespace

TEST(UnixSocketBackpressure, AClientThatDoesNotReadStopsBeingReadAndLaterGetsEveryReply) {
  constexpr size_t kReplyBytes = 1024;
  auto object = std::make_shared<BigReplyObject>(kReplyBytes);
  SXUnixSocketListener::Options options;
  options.maxPendingReplyBytes = 64 * 1024;
  ServedListener served(options, object);

  constexpr int kRequests = 20'000;  // 20 MB of replies, far more than the socket buffers
  int fd = connectTo(served.path());
  std::thread writer([fd] { writeRequests(fd, kRequests); });
  ASSERT_TRUE(waitFor([&] { return served.listener().backpressurePauses() >= 1; }));
  // Once the socket buffers are full the connection stays paused: nothing more is taken while
  // the client does not read.
  int64_t taken = -1;
  ASSERT_TRUE(waitFor([&] {
    int64_t before = object->handedOn();
    std::this_thread::sleep_for(300ms);
    taken = object->handedOn();
    return taken == before;
  }));
  EXPECT_LT(taken, kRequests / 2);

  EXPECT_EQ(readResponses(fd, kRequests), range(kRequests));
  writer.join();
  EXPECT_EQ(object->handedOn(), kRequests);
  ::close(fd);
}

TEST(UnixSocketBackpressure, WithoutPressureNothingPauses) {
  SXAsioDispatch dispatch;
  auto queue = dispatch.createSerialQueue("test", SXQualityOfService::kUserInteractive);
  auto object = std::make_shared<QueueingObject>(queue);
  object->open();
  SXUnixSocketListener::Options options;
  options.requestQueue = queue;
  ServedListener served(options, object);

  int fd = connectTo(served.path());
  for (int round = 0; round < 50; ++round) {  // ping-pong: one request in flight at a time
    msgpack::sbuffer out;
    RpcEncodeRequest(out, static_cast<uint32_t>(round), "echo", SXValue::array({round}));
    ASSERT_EQ(::write(fd, out.data(), out.size()), static_cast<ssize_t>(out.size()));
    ASSERT_EQ(readResponses(fd, 1), std::vector<int64_t>{round});
  }
  EXPECT_EQ(served.listener().backpressurePauses(), 0u);
  ::close(fd);
}

TEST(UnixSocketBackpressure, ABlockedQueueStopsReadingAtTheLimitAndEverythingFlowsOnceItRuns) {
  SXAsioDispatch dispatch;
  auto queue = dispatch.createSerialQueue("test", SXQualityOfService::kUserInteractive);
  auto object = std::make_shared<QueueingObject>(queue);  // its queue waits for open()
  SXUnixSocketListener::Options options;
  options.requestQueue = queue;
  options.maxQueuedRequests = 16;
  ServedListener served(options, object);

  constexpr int kRequests = 20'000;
  int fd = connectTo(served.path());
  std::thread writer([fd] { writeRequests(fd, kRequests); });
  ASSERT_TRUE(waitFor([&] { return served.listener().backpressurePauses() >= 1; }));
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(object->handedOn(), 16);  // stopped reading exactly at the limit

  object->open();
  EXPECT_EQ(readResponses(fd, kRequests), range(kRequests));
  writer.join();
  EXPECT_LE(object->maxWaiting(), 16);
  ::close(fd);
}

// A request that stops arriving half-way ends its connection once the timeout has passed,
// while a connection whose requests complete is kept however long it stays.
TEST(UnixSocketBackpressure, AnUnfinishedRequestEndsItsConnectionAfterTheTimeout) {
  auto queue = std::make_shared<SXAsioDispatch>()->createSerialQueue(
      "requests", SXQualityOfService::kUserInteractive);
  auto object = std::make_shared<QueueingObject>(queue);
  object->open();
  SXUnixSocketListener::Options options;
  options.partialFrameTimeout = 200ms;
  options.requestQueue = queue;
  ServedListener served(options, object);
  int partial = connectTo(served.path());
  int whole = connectTo(served.path());
  msgpack::sbuffer request;
  RpcEncodeRequest(request, 1, "echo", SXValue::array({1}));
  ASSERT_EQ(::write(partial, request.data(), request.size() - 1),
            static_cast<ssize_t>(request.size() - 1));
  writeRequests(whole, 1);
  EXPECT_EQ(readResponses(whole, 1), range(1));
  ASSERT_TRUE(waitFor([&] { return served.listener().partialFrameTimeouts() == 1; }));
  char byte;
  EXPECT_EQ(::read(partial, &byte, 1), 0);  // closed by the daemon
  // `whole` has been open longer than the timeout by now, and is still served.
  writeRequests(whole, 2);
  EXPECT_EQ(readResponses(whole, 2), range(2));
  ::close(partial);
  ::close(whole);
}

// While the connections together hold more than the pool allows, one that holds next to
// nothing is still read and answered; the one that filled the pool waits for room.
TEST(UnixSocketBackpressure, AQuietConnectionIsServedWhileAnotherFillsThePool) {
  auto queue = std::make_shared<SXAsioDispatch>()->createSerialQueue(
      "requests", SXQualityOfService::kUserInteractive);
  auto object = std::make_shared<QueueingObject>(queue);  // its gate stays shut for now
  SXUnixSocketListener::Options options;
  options.maxQueuedRequests = 100000;
  options.maxInflightBytes = 64 * 1024;
  options.requestQueue = queue;
  ServedListener served(options, object);
  int noisy = connectTo(served.path());
  std::thread writer([&] { writeRequests(noisy, 5000); });
  ASSERT_TRUE(waitFor([&] { return served.listener().inflightBytes() > 64 * 1024; }));
  ASSERT_TRUE(waitFor([&] { return served.listener().backpressurePauses() > 0; }));
  int64_t before = object->handedOn();  // the noisy connection is not read any more
  int quiet = connectTo(served.path());
  writeRequests(quiet, 1);
  ASSERT_TRUE(waitFor([&] { return object->handedOn() == before + 1; }));
  object->open();
  EXPECT_EQ(readResponses(quiet, 1), range(1));
  EXPECT_EQ(readResponses(noisy, 5000), range(5000));
  writer.join();
  ::close(noisy);
  ::close(quiet);
}
