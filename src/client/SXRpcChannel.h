// The socket side of SXReportingClient: one MessagePack-RPC connection over a Unix stream
// socket, with pipelined calls, batched writes and per-call time-outs.
//
// Threads: connect, call, close and connected may be called from any thread; connect must not
// be called from the I/O thread (it waits for it). run() is the I/O thread's body: it does all
// socket and timer work and runs every completion. Each call completes exactly once.
#pragma once

#include <asio.hpp>
#include <chrono>
#include <functional>
#include <future>
#include <map>
#include <msgpack.hpp>
#include <mutex>
#include <string>
#include <unordered_map>

#include "common/RpcCodec.h"
#include "common/SXThreadSafety.h"
#include "sxreporting/client.h"

class SXRpcChannel {
 public:
  using Completion = std::function<void(SXCallResult<SXValue>)>;

  SXRpcChannel(std::string socketPath, std::chrono::milliseconds defaultTimeout);
  SXRpcChannel(const SXRpcChannel&) = delete;
  SXRpcChannel& operator=(const SXRpcChannel&) = delete;

  // Runs the I/O loop until shutdown() and the last handler finished.
  void run();
  // Closes the connection and lets run() return.
  void shutdown();

  // Only the first call connects; later calls tell whether that one succeeded. On failure
  // returns false and stores why in `error` (when given).
  bool connect(std::string* error);
  void close();
  bool connected() const;
  const std::string& socketPath() const { return socketPath_; }

  // Sends `[0, msgid, method, params]`; `done` runs on the I/O thread with the outcome.
  void call(std::string_view method, const SXValue& params, SXTimeout timeout, Completion done);

 private:
  using Clock = std::chrono::steady_clock;
  enum class State { kIdle, kConnecting, kConnected, kClosed };
  struct Pending {
    Completion done;
    std::chrono::milliseconds timeout;  // for the time-out message
    std::multimap<Clock::time_point, uint32_t>::iterator deadline;
    bool hasDeadline = false;
  };

  void onConnected(const asio::error_code& error, std::promise<std::string>& result);
  void startRead();
  bool drainReplies();
  void handleMessage(const SXValue& message);
  void flush();
  void armTimer();
  void expireCalls();
  // Ends the connection: every pending call completes with kConnectionLost and `reason`.
  void fail(const std::string& reason);
  void forget(Pending& pending) SX_REQUIRES(mutex_);
  static void complete(const Completion& done, SXCallResult<SXValue> result);

  const std::string socketPath_;
  const std::chrono::milliseconds defaultTimeout_;

  asio::io_context io_;
  asio::executor_work_guard<asio::io_context::executor_type> work_;  // I/O thread only
  asio::local::stream_protocol::socket socket_;                      // I/O thread only
  asio::steady_timer timer_;                                         // I/O thread only
  RpcStreamDecoder decoder_;                                         // I/O thread only
  msgpack::sbuffer writing_;  // I/O thread only: the bytes of the write in flight

  mutable SXMutex mutex_;
  State state_ SX_GUARDED_BY(mutex_) = State::kIdle;
  std::string closeReason_ SX_GUARDED_BY(mutex_);
  uint32_t nextMsgid_ SX_GUARDED_BY(mutex_) = 1;
  std::unordered_map<uint32_t, Pending> pending_ SX_GUARDED_BY(mutex_);
  std::multimap<Clock::time_point, uint32_t> deadlines_ SX_GUARDED_BY(mutex_);
  Clock::time_point timerArmedFor_ SX_GUARDED_BY(mutex_) = Clock::time_point::max();
  msgpack::sbuffer outbox_ SX_GUARDED_BY(mutex_);      // requests not yet handed to a write
  bool writeScheduled_ SX_GUARDED_BY(mutex_) = false;  // a write is in flight or a flush posted
};
