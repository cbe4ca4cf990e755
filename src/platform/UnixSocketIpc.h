// Production IPC: a Unix stream socket carrying MessagePack-RPC.
//
// The listener binds the socket path (or adopts a socket passed by the service manager as fd 3
// through LISTEN_FDS/LISTEN_PID) and serves every connection on the thread that calls
// `resume`; that thread is "the connection's thread" for requests and handlers. Replies may be
// sent from any thread: they are encoded at once, appended to the connection's output under a
// lock, and written by the I/O thread in batches.
//
// A request that is not a well-formed MessagePack-RPC request but carries a msgid gets an
// error response; bytes that are not MessagePack, a message larger than the limit or nested
// too deeply end the connection (interruption, then invalidation).
//
// Back-pressure: a connection stops reading while `maxQueuedRequests` of its requests have
// been handed on but not yet handled, or while more than `maxPendingReplyBytes` of its replies
// wait to be written (a client that does not read its replies); it reads again once both are
// below their limits. Nothing is dropped: the client's writes simply block. A request counts as
// handled once the serial `requestQueue` (the queue the exported objects hand their work to)
// has run everything queued before a marker task posted after it; without a queue, once
// `handleRequest` returns.
#pragma once

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <atomic>
#include <memory>
#include <mutex>
#include <set>

#include "common/RpcCodec.h"
#include "platform/Dispatch.h"
#include "platform/Ipc.h"
#include "platform/Log.h"

class SXUnixSocketConnection;

class SXUnixSocketListener final : public SXIpcListener {
 public:
  struct Options {
    std::string socketPath;
    unsigned socketMode = 0660;
    RpcLimits limits;
    size_t maxQueuedRequests = 1024;
    size_t maxPendingReplyBytes = 4 << 20;
    std::shared_ptr<SXWorkQueue> requestQueue;
  };

  SXUnixSocketListener(Options options, std::shared_ptr<SXLogFacility> log);
  ~SXUnixSocketListener() override;

  // Binds and listens, or adopts a socket-activated one. On failure returns false and says why.
  bool open(std::string& error);
  // Whether `open` adopted a socket from the service manager.
  bool socketActivated() const { return activated_; }

  void setDelegate(std::shared_ptr<SXIpcListenerDelegate> delegate) override;
  void resume() override;
  // Ends `resume` from any thread; open connections are closed.
  void stop();

  // How many times a connection stopped reading because of back-pressure. Any thread.
  uint64_t backpressurePauses() const { return pauses_.load(std::memory_order_relaxed); }

  void connectionClosed(const std::shared_ptr<SXUnixSocketConnection>& connection);
  void connectionPaused() { pauses_.fetch_add(1, std::memory_order_relaxed); }

 private:
  void accept();

  Options options_;
  std::shared_ptr<SXLogFacility> log_;
  asio::io_context io_;
  asio::local::stream_protocol::acceptor acceptor_;
  std::shared_ptr<SXIpcListenerDelegate> delegate_;
  bool activated_ = false;
  std::atomic<uint64_t> pauses_{0};
  // Live connections, so that stop() can close them all. Touched only on the I/O thread.
  std::set<std::shared_ptr<SXUnixSocketConnection>> connections_;
};
