#include "ClientPool.h"

#include <asio/post.hpp>
#include <condition_variable>
#include <future>
#include <mutex>

#include "common/SXThreadSafety.h"

namespace {

// Counts the clients that have not finished the phase.
class Latch {
 public:
  explicit Latch(size_t count) : remaining_(count) {}
  void countDown() {
    SXMutexLock lock(mutex_);
    if (remaining_ > 0 && --remaining_ == 0) done_.notify_all();
  }
  bool waitFor(std::chrono::milliseconds timeout) {
    SXMutexLock lock(mutex_);
    return lock.waitFor(done_, timeout, [&]() SX_REQUIRES(mutex_) { return remaining_ == 0; });
  }

 private:
  SXMutex mutex_;
  std::condition_variable done_;
  size_t remaining_ SX_GUARDED_BY(mutex_);
};

}  // namespace

ClientPool::~ClientPool() { stop(); }

std::optional<std::string> ClientPool::connect(const std::string& socketPath, size_t count,
                                               size_t window, bool checkResults) {
  for (size_t i = 0; i < count; ++i) {
    auto client = std::make_unique<PipelinedRpcClient>(io_, window, checkResults);
    std::string error;
    if (!client->connect(socketPath, error)) return error;
    clients_.push_back(std::move(client));
  }
  work_.emplace(io_.get_executor());
  thread_ = std::thread([this] { io_.run(); });
  return std::nullopt;
}

pid_t ClientPool::peerPid() {
  pid_t pid = -1;
  if (!clients_.empty()) onIoThread([&] { pid = clients_[0]->peerPid(); });
  return pid;
}

void ClientPool::onIoThread(const std::function<void()>& task) {
  std::promise<void> finished;
  asio::post(io_, [&] {
    task();
    finished.set_value();
  });
  finished.get_future().wait();
}

uint64_t ClientPool::replies() const {
  uint64_t total = 0;
  for (const auto& client : clients_) total += client->replies();
  return total;
}

uint64_t ClientPool::measuredReplies() const {
  uint64_t total = 0;
  for (const auto& client : clients_) total += client->measuredReplies();
  return total;
}

std::optional<std::string> ClientPool::runPhase(const std::function<RequestSource(size_t)>& sources,
                                                bool awaitAll,
                                                std::chrono::milliseconds replyTimeout,
                                                const std::function<void()>& tick) {
  auto latch = std::make_shared<Latch>(clients_.size());
  for (size_t i = 0; i < clients_.size(); ++i) {
    asio::post(io_, [client = clients_[i].get(), source = sources(i), awaitAll, latch]() mutable {
      client->runPhase(std::move(source), awaitAll, [latch] { latch->countDown(); });
    });
  }
  uint64_t lastReplies = replies();
  auto lastProgress = std::chrono::steady_clock::now();
  std::optional<std::string> failure;
  while (!latch->waitFor(std::chrono::milliseconds(20))) {
    if (tick) tick();
    auto now = std::chrono::steady_clock::now();
    if (uint64_t seen = replies(); seen != lastReplies) {
      lastReplies = seen;
      lastProgress = now;
    } else if (now - lastProgress > replyTimeout && !failure) {
      size_t waiting = 0;
      onIoThread([&] {
        for (const auto& client : clients_) waiting += client->inFlight();
      });
      failure = "no reply for " + std::to_string(replyTimeout.count() / 1000) + " s (" +
                std::to_string(waiting) + " requests unanswered)";
      onIoThread([&] {
        for (const auto& client : clients_) client->abort(*failure);
      });
    }
  }
  if (failure) return failure;
  onIoThread([&] {
    for (const auto& client : clients_) {
      if (client->failed() && !failure) failure = client->error();
    }
  });
  return failure;
}

void ClientPool::stop() {
  if (!thread_.joinable()) return;
  onIoThread([&] {
    for (const auto& client : clients_) client->close();
  });
  work_.reset();
  io_.stop();
  thread_.join();
}

LatencyHistogram ClientPool::latency() const {
  LatencyHistogram merged;
  for (const auto& client : clients_) merged.merge(client->latency());
  return merged;
}

uint64_t ClientPool::rejected() const {
  uint64_t total = 0;
  for (const auto& client : clients_) total += client->rejected();
  return total;
}

std::string ClientPool::firstRejection() const {
  for (const auto& client : clients_) {
    if (client->rejected() > 0) return client->error();
  }
  return "";
}
