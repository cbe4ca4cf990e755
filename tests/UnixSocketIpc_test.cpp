// Back-pressure of the socket listener: a connection stops reading exactly when too many of its
// requests wait to be handled, loses nothing, and answers every request in order once the queue
// runs; a request that never completes ends its connection. Unread replies and a full pool are
// tested through the real daemon (e2e/Backpressure, e2e/Faults).
#include "platform/UnixSocketIpc.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <thread>

#include "common/SXThreadSafety.h"
#include "platform/AsioDispatch.h"
#include "support/Daemon.h"
#include "support/RawSocket.h"

namespace {

using namespace std::chrono_literals;

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
    SXStatus opened = listener_->open();
    EXPECT_TRUE(opened.ok()) << opened.error();
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

// Writes `count` requests whose first param is their index.
void writeRequests(int fd, int count) {
  SXTestWriteRequests(fd, count, [](msgpack::sbuffer& out, int i) {
    RpcEncodeRequest(out, static_cast<uint32_t>(i), "echo", SXValue::array({i}));
  });
}

}  // namespace

TEST(UnixSocketBackpressure, WithoutPressureNothingPauses) {
  SXAsioDispatch dispatch;
  auto queue = dispatch.createSerialQueue("test", SXQualityOfService::kUserInteractive);
  auto object = std::make_shared<QueueingObject>(queue);
  object->open();
  SXUnixSocketListener::Options options;
  options.requestQueue = queue;
  ServedListener served(options, object);

  int fd = SXTestConnect(served.path());
  for (int round = 0; round < 50; ++round) {  // ping-pong: one request in flight at a time
    msgpack::sbuffer out;
    RpcEncodeRequest(out, static_cast<uint32_t>(round), "echo", SXValue::array({round}));
    ASSERT_EQ(::write(fd, out.data(), out.size()), static_cast<ssize_t>(out.size()));
    ASSERT_EQ(SXTestReadResponseIds(fd, 1), std::vector<int64_t>{round});
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
  int fd = SXTestConnect(served.path());
  std::thread writer([fd] { writeRequests(fd, kRequests); });
  ASSERT_TRUE(waitUntil([&] { return served.listener().backpressurePauses() >= 1; }));
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(object->handedOn(), 16);  // stopped reading exactly at the limit

  object->open();
  EXPECT_EQ(SXTestReadResponseIds(fd, kRequests), SXTestIds(kRequests));
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
  int partial = SXTestConnect(served.path());
  int whole = SXTestConnect(served.path());
  msgpack::sbuffer request;
  RpcEncodeRequest(request, 1, "echo", SXValue::array({1}));
  ASSERT_EQ(::write(partial, request.data(), request.size() - 1),
            static_cast<ssize_t>(request.size() - 1));
  writeRequests(whole, 1);
  EXPECT_EQ(SXTestReadResponseIds(whole, 1), SXTestIds(1));
  ASSERT_TRUE(waitUntil([&] { return served.listener().partialFrameTimeouts() == 1; }));
  char byte;
  EXPECT_EQ(::read(partial, &byte, 1), 0);  // closed by the daemon
  // `whole` has been open longer than the timeout by now, and is still served.
  writeRequests(whole, 2);
  EXPECT_EQ(SXTestReadResponseIds(whole, 2), SXTestIds(2));
  ::close(partial);
  ::close(whole);
}
