// An in-process MessagePack-RPC server on a Unix socket in a fresh temporary directory, standing
// in for the reporting service in client tests. It answers requests from a table of handlers
// (a method without one gets an error response), records every request, can withhold replies
// and answer them later in any order, send raw bytes, and drop its connections.
//
// All methods may be called from any thread; handlers run on the server's own I/O thread.
#pragma once

#include <asio.hpp>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
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
  void sendBytes(std::string bytes);
  void closeConnections();

 private:
  class Connection;
  void accept();
  void handle(const std::shared_ptr<Connection>& connection, const SXValue& message);
  void forEachConnection(std::function<void(Connection&)> action);

  std::string directory_;
  std::string socketPath_;
  asio::io_context io_;
  asio::local::stream_protocol::acceptor acceptor_;
  std::set<std::shared_ptr<Connection>> connections_;  // I/O thread only

  mutable SXMutex mutex_;
  std::condition_variable changed_;
  std::map<std::string, Handler> handlers_ SX_GUARDED_BY(mutex_);
  std::vector<Request> requests_ SX_GUARDED_BY(mutex_);
  size_t connectionCount_ SX_GUARDED_BY(mutex_) = 0;  // accepted so far

  std::thread thread_;
};
