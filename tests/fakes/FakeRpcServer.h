// An in-process MessagePack-RPC server on a Unix socket in a fresh temporary directory, standing
// in for the reporting service in client tests. It answers requests from a table of handlers
// (a method without one gets an error response), records every request, can withhold replies
// and answer them later in any order, send raw bytes, and drop its connections.
//
// All methods may be called from any thread; each connection's handlers run on its own thread.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "sxreporting/types.h"

class FakeRpcServer {
 public:
  // What a handler answers with.
  struct Answer {
    SXValue error;  // non-null: an error response
    SXValue result;
    bool withhold = false;  // send nothing (the test may respond() later)

    static Answer reply(SXValue result) { return {nullptr, std::move(result), false}; }
    static Answer fail(std::string error) { return {std::move(error), nullptr, false}; }
    static Answer none() { return {nullptr, nullptr, true}; }
  };
  using Handler = std::function<Answer(const SXValue& params)>;

  struct Request {
    uint32_t msgid = 0;
    std::string method;
    SXValue params;
  };

  FakeRpcServer();
  ~FakeRpcServer();
  FakeRpcServer(const FakeRpcServer&) = delete;
  FakeRpcServer& operator=(const FakeRpcServer&) = delete;

  const std::string& directory() const { return directory_; }
  const std::string& socketPath() const { return socketPath_; }

  void on(const std::string& method, Handler handler);

  std::vector<Request> requests() const;
  // Waits until at least `count` requests have arrived. False when they did not in time.
  bool waitForRequests(size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(10));
  size_t connectionCount() const;  // accepted so far

  // Sends to every open connection.
  void respond(uint32_t msgid, const SXValue& error, const SXValue& result);
  void sendBytes(const std::string& bytes);
  void closeConnections();

 private:
  struct Connection {
    int fd;
    bool open;
  };
  void acceptLoop();
  void readLoop(int fd);
  // Sockets are closed only by the destructor, so that a number is never reused meanwhile.
  void sendTo(int fd, const std::string& bytes) SX_REQUIRES(mutex_);

  std::string directory_;
  std::string socketPath_;
  int listener_ = -1;

  mutable SXMutex mutex_;
  std::condition_variable changed_;
  std::map<std::string, Handler> handlers_ SX_GUARDED_BY(mutex_);
  std::vector<Request> requests_ SX_GUARDED_BY(mutex_);
  std::vector<Connection> connections_ SX_GUARDED_BY(mutex_);  // every one accepted
  std::vector<std::thread> readers_ SX_GUARDED_BY(mutex_);
  std::thread acceptor_;
};
