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
#pragma once

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <memory>
#include <mutex>
#include <set>

#include "common/RpcCodec.h"
#include "platform/Ipc.h"
#include "platform/Log.h"

class SXUnixSocketConnection;

class SXUnixSocketListener final : public SXIpcListener {
 public:
  struct Options {
    std::string socketPath;
    unsigned socketMode = 0660;
    RpcLimits limits;
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

  void connectionClosed(const std::shared_ptr<SXUnixSocketConnection>& connection);

 private:
  void accept();

  Options options_;
  std::shared_ptr<SXLogFacility> log_;
  asio::io_context io_;
  asio::local::stream_protocol::acceptor acceptor_;
  std::shared_ptr<SXIpcListenerDelegate> delegate_;
  bool activated_ = false;
  // Live connections, so that stop() can close them all. Touched only on the I/O thread.
  std::set<std::shared_ptr<SXUnixSocketConnection>> connections_;
};
