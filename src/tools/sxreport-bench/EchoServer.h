// The physical baseline: a MessagePack-RPC server on a Unix stream socket that decodes every
// request and answers it at once with [1, msgid, nil, nil]. What the daemon costs beyond this
// is the daemon's own work.
//
// Threads: start() and stop() from one thread; the server runs on a thread of its own.
#pragma once

#include <pthread.h>

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <optional>
#include <string>
#include <thread>

class EchoServer {
 public:
  EchoServer();
  ~EchoServer();  // stops
  EchoServer(const EchoServer&) = delete;
  EchoServer& operator=(const EchoServer&) = delete;

  // Listens on `socketPath` (replacing a stale socket file) and starts serving. On failure
  // returns false and says why in `error`.
  bool start(const std::string& socketPath, std::string& error);
  void stop();
  // CPU seconds the serving thread has used (nanosecond resolution); nothing before start().
  std::optional<double> cpuSeconds() const;

 private:
  class Connection;
  void accept();

  asio::io_context io_;
  asio::local::stream_protocol::acceptor acceptor_;
  std::thread thread_;
  pthread_t nativeThread_{};  // thread_'s, for its CPU clock
  std::string socketPath_;
};
