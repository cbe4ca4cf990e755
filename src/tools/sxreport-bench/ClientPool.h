// N benchmark clients on one I/O thread, and the running of a phase on all of them at once.
//
// Threads: every method from one controlling thread; the clients run on the pool's own
// I/O thread, which the pool starts on connect() and joins on stop() (or destruction).
#pragma once

#include <sys/types.h>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "PipelinedRpcClient.h"

class ClientPool {
 public:
  ClientPool() = default;
  ~ClientPool();  // stops
  ClientPool(const ClientPool&) = delete;
  ClientPool& operator=(const ClientPool&) = delete;

  // Connects `count` clients. On failure returns why.
  std::optional<std::string> connect(const std::string& socketPath, size_t count, size_t window,
                                     bool checkResults);
  // The server's process, seen from the first connection; -1 when unknown.
  pid_t peerPid();

  // Runs one phase on every client, calling `tick` about every 20 ms while it runs. On failure
  // (a connection failed, or no reply came for `replyTimeout`) returns why.
  std::optional<std::string> runPhase(const std::function<RequestSource(size_t)>& sources,
                                      bool awaitAll, std::chrono::milliseconds replyTimeout,
                                      const std::function<void()>& tick = nullptr);

  uint64_t measuredReplies() const;
  // Ends every connection and joins the I/O thread; the figures below are final after it.
  void stop();
  LatencyHistogram latency() const;
  uint64_t rejected() const;
  // The first rejected reply, if any.
  std::string firstRejection() const;

 private:
  uint64_t replies() const;
  // Runs `task` on the I/O thread and waits for it.
  void onIoThread(const std::function<void()>& task);

  asio::io_context io_;
  std::optional<asio::executor_work_guard<asio::io_context::executor_type>> work_;
  std::vector<std::unique_ptr<PipelinedRpcClient>> clients_;
  std::thread thread_;
};
