// Production IPC: a Unix stream socket carrying MessagePack-RPC.
//
// The listener binds the socket path (or adopts the one listening Unix stream socket that the
// service manager passed through LISTEN_FDS/LISTEN_PID) and serves every connection on the
// thread that calls `resume`; that thread is "the connection's thread" for requests and
// handlers. Replies may be sent from any thread: they are encoded at once, appended to the
// connection's output under a lock, and written by the I/O thread in batches.
//
// A request that is not a well-formed MessagePack-RPC request but carries a msgid gets an
// error response; bytes that are not MessagePack, a message larger than the limit or nested
// too deeply end the connection (interruption, then invalidation).
//
// Back-pressure: a connection stops reading while `maxQueuedRequests` of its requests have
// been handed on but not yet handled, while more than `maxPendingReplyBytes` of its replies
// wait to be written (a client that does not read its replies), or while its byte budget
// (`budget()`: its requests until handled, and whatever the exported object charges to it) is
// over its limit; it reads again once all are below their limits. Nothing is dropped: the
// client's writes simply block. A request counts as handled once the serial `requestQueue`
// (the queue the exported objects hand their work to) has run everything queued before a
// marker task posted after it; without a queue, once `handleRequest` returns.
//
// Every connection's budget and every partly received request share one pool of
// `maxInflightBytes`. While the pool is full, a connection reads only while it holds less than
// a small floor, so an abusive client cannot starve a quiet one. A request whose first bytes
// have arrived must be complete within `partialFrameTimeout` of reading, or the connection
// ends; time the daemon itself spends not reading a connection does not count.
#pragma once

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <set>

#include "common/RpcCodec.h"
#include "common/SXThreadSafety.h"
#include "platform/Dispatch.h"
#include "platform/Ipc.h"
#include "platform/Log.h"
#include "platform/Status.h"

class SXUnixSocketConnection;

class SXUnixSocketListener final : public SXIpcListener {
 public:
  struct Options {
    std::string socketPath;
    unsigned socketMode = 0660;
    RpcLimits limits;
    size_t maxQueuedRequests = 1024;
    size_t maxPendingReplyBytes = 4 << 20;
    uint64_t maxConnectionBytes = 4 << 20;
    uint64_t maxInflightBytes = 16 << 20;
    std::chrono::milliseconds partialFrameTimeout{30'000};
    std::shared_ptr<SXWorkQueue> requestQueue;
  };
  // What a connection may hold while the pool is full.
  static constexpr uint64_t kConnectionFloorBytes = 16 * 1024;

  SXUnixSocketListener(Options options, std::shared_ptr<SXLogFacility> log);
  ~SXUnixSocketListener() override;

  // Binds and listens, or adopts a socket-activated one.
  SXStatus open();
  // Whether `open` adopted a socket from the service manager.
  bool socketActivated() const { return activated_; }

  void setDelegate(std::shared_ptr<SXIpcListenerDelegate> delegate) override;
  void resume() override;
  // Ends `resume` from any thread; open connections are closed.
  void stop();

  // The I/O thread's executor, for the daemon's signals and timers.
  asio::io_context::executor_type executor() { return io_.get_executor(); }
  // I/O thread, for a stop: accepts no more connections and starts no more reads; the
  // requests already received are still handled and answered, and clients' writes wait.
  void stopReading();
  // I/O thread: ends every connection (their invalidation handlers run); returns how many.
  size_t closeConnections();
  bool reading() const { return reading_; }

  // How many times a connection stopped reading because of back-pressure. Any thread.
  uint64_t backpressurePauses() const { return pauses_.load(std::memory_order_relaxed); }

  // Connections ended because a request did not complete in time. Any thread.
  uint64_t partialFrameTimeouts() const { return timeouts_.load(std::memory_order_relaxed); }
  // Bytes that all connections together make the service hold now. Any thread.
  uint64_t inflightBytes() const { return pool_->held(); }

  void connectionClosed(const std::shared_ptr<SXUnixSocketConnection>& connection);
  void connectionPaused() { pauses_.fetch_add(1, std::memory_order_relaxed); }
  void partialFrameTimedOut() { timeouts_.fetch_add(1, std::memory_order_relaxed); }
  const std::shared_ptr<SXByteBudget>& pool() const { return pool_; }

 private:
  void accept();
  // I/O thread: lets every connection that waits for room in the pool look again.
  void resumePaused();

  // The pool's waker may run on any thread after the listener is gone.
  struct WakeTarget {
    SXMutex mutex;
    SXUnixSocketListener* listener SX_GUARDED_BY(mutex) = nullptr;
  };

  Options options_;
  std::shared_ptr<SXLogFacility> log_;
  asio::io_context io_;
  asio::local::stream_protocol::acceptor acceptor_;
  std::shared_ptr<SXIpcListenerDelegate> delegate_;
  bool activated_ = false;
  bool reading_ = true;  // I/O thread only
  std::atomic<uint64_t> pauses_{0};
  std::atomic<uint64_t> timeouts_{0};
  std::shared_ptr<SXByteBudget> pool_;
  std::shared_ptr<WakeTarget> wakeTarget_;
  // Live connections, so that stop() can close them all. Touched only on the I/O thread.
  std::set<std::shared_ptr<SXUnixSocketConnection>> connections_;
};
