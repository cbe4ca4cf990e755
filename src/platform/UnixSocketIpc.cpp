#include "platform/UnixSocketIpc.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <asio/write.hpp>
#include <cstdlib>

#include "platform/FileSystem.h"

// One client connection. Lives while the I/O thread has an operation pending on it.
class SXUnixSocketConnection final : public SXIpcConnection,
                                     public std::enable_shared_from_this<SXUnixSocketConnection> {
 public:
  SXUnixSocketConnection(asio::local::stream_protocol::socket socket,
                         const SXUnixSocketListener::Options& options,
                         SXUnixSocketListener& listener, std::shared_ptr<SXLogFacility> log)
      : socket_(std::move(socket)),
        decoder_(options.limits),
        maxQueuedRequests_(options.maxQueuedRequests),
        maxPendingReplyBytes_(options.maxPendingReplyBytes),
        requestQueue_(options.requestQueue),
        listener_(listener),
        log_(std::move(log)) {
    struct ucred cred {};
    socklen_t len = sizeof cred;
    if (::getsockopt(socket_.native_handle(), SOL_SOCKET, SO_PEERCRED, &cred, &len) == 0) {
      pid_ = cred.pid;
    }
    fd_ = socket_.native_handle();
  }

  int32_t processIdentifier() const override { return pid_; }
  std::string description() const override {
    return "<connection pid=" + std::to_string(pid_) + " fd=" + std::to_string(fd_) + ">";
  }
  void setExportedObject(std::shared_ptr<SXIpcExportedObject> object) override {
    exported_ = std::move(object);
  }
  void setInterruptionHandler(std::function<void()> handler) override {
    interruption_ = std::move(handler);
  }
  void setInvalidationHandler(std::function<void()> handler) override {
    invalidation_ = std::move(handler);
  }
  void resume() override { read(); }

  // Any thread. Encodes straight into the pending output; the I/O thread writes whatever has
  // gathered there in one go.
  void send(uint32_t msgid, const SXValue& error, const SXValue& result) {
    bool startWriting = false;
    {
      std::lock_guard lock(outMutex_);
      if (closed_) return;
      size_t before = outPending_.size();
      RpcEncodeResponse(outPending_, msgid, error, result);
      pendingReplyBytes_.fetch_add(outPending_.size() - before);
      startWriting = !writing_;
      writing_ = true;
    }
    if (startWriting) {
      asio::post(socket_.get_executor(), [self = shared_from_this()] { self->write(); });
    }
  }

  // I/O thread: ends the connection; `interrupted` when it ended badly.
  void end(bool interrupted) {
    if (ended_) return;
    ended_ = true;
    {
      std::lock_guard lock(outMutex_);
      closed_ = true;
    }
    std::error_code ignored;
    socket_.shutdown(asio::socket_base::shutdown_both, ignored);
    socket_.close(ignored);
    if (interrupted && interruption_) std::exchange(interruption_, nullptr)();
    if (invalidation_) std::exchange(invalidation_, nullptr)();
    exported_.reset();
    listener_.connectionClosed(shared_from_this());
  }

 private:
  void read() {
    char* buffer = decoder_.prepare(kReadSize);
    socket_.async_read_some(asio::buffer(buffer, kReadSize),
                            [self = shared_from_this()](const std::error_code& ec, size_t n) {
                              if (ec) {
                                self->end(ec != asio::error::eof);
                                return;
                              }
                              self->decoder_.commit(n);
                              self->serve();
                            });
  }

  // I/O thread: hands on the requests already buffered, then reads more once they are all
  // handed on, unless back-pressure says to wait.
  void serve() {
    for (;;) {
      Dispatched dispatched = dispatchMessages();
      if (dispatched == Dispatched::kEnded) return;
      if (!mustWait()) {
        // Room was made while dispatching stopped: whole requests may still be buffered, and
        // the client may have nothing more to send, so those go first.
        if (dispatched == Dispatched::kDrained) {
          read();
          return;
        }
        continue;
      }
      // Room may have been made between the test and the flag: look again after raising it,
      // so that a wake-up is never missed.
      paused_.store(true);
      if (mustWait()) {
        listener_.connectionPaused();
        return;
      }
      paused_.store(false);
    }
  }

  bool mustWait() const {
    return queued_.load() >= maxQueuedRequests_ ||
           pendingReplyBytes_.load() > maxPendingReplyBytes_;
  }

  // I/O thread, after a marker ran or a write finished.
  void resumeIfAllowed() {
    if (ended_ || !paused_.load() || mustWait()) return;
    paused_.store(false);
    serve();
  }

  enum class Dispatched { kDrained, kStopped, kEnded };

  // Hands every whole message to the exported object, stopping early when back-pressure
  // says wait. kDrained: no whole message is left; kStopped: back-pressure stopped it with
  // messages left; kEnded: the stream broke or the connection ended.
  Dispatched dispatchMessages() {
    SXValue message;
    bool ok = true;
    bool drained = false;
    while (ok && !ended_ && !mustWait()) {
      auto status = decoder_.next(message);
      if (status == RpcStreamDecoder::Status::kNeedMore) {
        drained = true;
        break;
      }
      if (status == RpcStreamDecoder::Status::kBroken) {
        SXLOG(*log_, nullptr, SXLogLevel::kError, "closing %@: %@", description(),
              decoder_.error());
        ok = false;
      } else {
        ok = dispatch(message);
      }
    }
    coverDispatched();
    if (!ok) end(true);
    if (!ok || ended_) return Dispatched::kEnded;
    return drained ? Dispatched::kDrained : Dispatched::kStopped;
  }

  // Moves the request out of `message`.
  bool dispatch(SXValue& message) {
    std::string why;
    std::optional<uint32_t> msgid;
    auto request = RpcParseRequest(std::move(message), why, msgid);
    if (!request) {
      if (!msgid) {
        SXLOG(*log_, nullptr, SXLogLevel::kError, "closing %@: %@", description(), why);
        return false;
      }
      send(*msgid, why, nullptr);
      return true;
    }
    if (!exported_) {
      send(request->msgid, "no object is exported on this connection", nullptr);
      return true;
    }
    if (requestQueue_) queued_.fetch_add(1);
    std::weak_ptr<SXUnixSocketConnection> weak = shared_from_this();
    uint32_t id = request->msgid;
    exported_->handleRequest(request->method, std::move(request->params),
                             [weak, id](const SXValue& error, const SXValue& result) {
                               if (auto self = weak.lock()) self->send(id, error, result);
                             });
    // Counted as uncovered only now that its work is on the queue: a marker posted from the
    // queue thread at this moment must not overtake it.
    if (requestQueue_) uncovered_.fetch_add(1);
    return true;
  }

  // Any thread: posts a marker behind the requests handed on since the last one, unless a
  // marker is already on its way (it posts the next one when it runs).
  void coverDispatched() {
    if (!requestQueue_ || uncovered_.load() == 0 || markerPending_.exchange(true)) return;
    uint64_t covered = uncovered_.exchange(0);
    std::weak_ptr<SXUnixSocketConnection> weak = shared_from_this();
    requestQueue_->async([weak, covered] {
      if (auto self = weak.lock()) self->requestsHandled(covered);
    });
  }

  // On the request queue: every request covered by this marker has been handled.
  void requestsHandled(uint64_t covered) {
    queued_.fetch_sub(covered);
    markerPending_.store(false);
    coverDispatched();
    if (paused_.load()) {
      asio::post(socket_.get_executor(), [self = shared_from_this()] { self->resumeIfAllowed(); });
    }
  }

  void write() {
    {
      std::lock_guard lock(outMutex_);
      if (closed_ || outPending_.empty()) {
        writing_ = false;
        return;
      }
      outFlight_.swap(outPending_);
    }
    asio::async_write(socket_, asio::buffer(outFlight_),
                      [self = shared_from_this()](const std::error_code& ec, size_t) {
                        self->pendingReplyBytes_.fetch_sub(self->outFlight_.size());
                        self->outFlight_.clear();
                        if (ec) {
                          self->end(true);
                          return;
                        }
                        self->write();
                        self->resumeIfAllowed();
                      });
  }

  static constexpr size_t kReadSize = 64 * 1024;

  asio::local::stream_protocol::socket socket_;
  RpcStreamDecoder decoder_;  // I/O thread only
  const size_t maxQueuedRequests_;
  const size_t maxPendingReplyBytes_;
  const std::shared_ptr<SXWorkQueue> requestQueue_;
  SXUnixSocketListener& listener_;
  std::shared_ptr<SXLogFacility> log_;
  int32_t pid_ = 0;
  int fd_ = -1;
  std::shared_ptr<SXIpcExportedObject> exported_;  // I/O thread only
  std::function<void()> interruption_;             // I/O thread only
  std::function<void()> invalidation_;             // I/O thread only
  bool ended_ = false;                             // I/O thread only
  // Back-pressure. Handed on but not yet handled; written by the I/O thread and the markers.
  std::atomic<uint64_t> queued_{0};
  std::atomic<uint64_t> uncovered_{0};        // handed on, no marker posted behind them yet
  std::atomic<bool> markerPending_{false};    // a marker is on the request queue
  std::atomic<bool> paused_{false};           // set by the I/O thread, read by markers
  std::atomic<size_t> pendingReplyBytes_{0};  // outPending_ plus outFlight_
  std::mutex outMutex_;
  std::string outPending_;  // GUARDED_BY(outMutex_)
  bool writing_ = false;    // GUARDED_BY(outMutex_)
  bool closed_ = false;     // GUARDED_BY(outMutex_)
  std::string outFlight_;   // I/O thread only, while a write is in flight
};

SXUnixSocketListener::SXUnixSocketListener(Options options, std::shared_ptr<SXLogFacility> log)
    : options_(std::move(options)), log_(std::move(log)), acceptor_(io_) {}

SXUnixSocketListener::~SXUnixSocketListener() = default;

bool SXUnixSocketListener::open(std::string& error) {
  std::error_code ec;
  const char* listenPid = std::getenv("LISTEN_PID");
  const char* listenFds = std::getenv("LISTEN_FDS");
  if (listenPid && listenFds && std::atoi(listenPid) == ::getpid() && std::atoi(listenFds) >= 1) {
    acceptor_.assign(asio::local::stream_protocol(), 3, ec);
    if (ec) {
      error = "cannot adopt the socket passed as fd 3: " + ec.message();
      return false;
    }
    activated_ = true;
    ::unsetenv("LISTEN_PID");
    ::unsetenv("LISTEN_FDS");
    return true;
  }
  ::unlink(options_.socketPath.c_str());  // a stale socket of an earlier run
  asio::local::stream_protocol::endpoint endpoint(options_.socketPath);
  acceptor_.open(endpoint.protocol(), ec);
  if (!ec) {
    // bind() creates the socket file with 0777 minus the umask. Adding the bits the configured
    // mode lacks to the process's own umask means the socket is never more open than asked,
    // not even until the chmod below; files other threads create meanwhile get the narrower
    // mask (for the instant between the two umask calls, the socket's mask alone).
    const mode_t refused = ~static_cast<mode_t>(options_.socketMode) & 0777;
    const mode_t processMask = ::umask(refused);
    ::umask(processMask | refused);
    acceptor_.bind(endpoint, ec);
    ::umask(processMask);
  }
  if (!ec) acceptor_.listen(asio::socket_base::max_listen_connections, ec);
  if (ec) {
    error = options_.socketPath + ": " + ec.message();
    return false;
  }
  // The umask can only take bits away, so the exact mode (perhaps wider than the umask) is set
  // here; until then the socket is at most as open as the mode.
  if (::chmod(options_.socketPath.c_str(), static_cast<mode_t>(options_.socketMode)) != 0) {
    error = SXPosixError(options_.socketPath, errno);
    return false;
  }
  return true;
}

void SXUnixSocketListener::setDelegate(std::shared_ptr<SXIpcListenerDelegate> delegate) {
  delegate_ = std::move(delegate);
}

void SXUnixSocketListener::resume() {
  accept();
  io_.run();
}

void SXUnixSocketListener::stop() {
  asio::post(io_, [this] {
    std::error_code ignored;
    acceptor_.close(ignored);
    auto live = connections_;
    for (const auto& connection : live) connection->end(false);
    io_.stop();
  });
}

void SXUnixSocketListener::connectionClosed(
    const std::shared_ptr<SXUnixSocketConnection>& connection) {
  connections_.erase(connection);
}

void SXUnixSocketListener::accept() {
  acceptor_.async_accept(
      [this](const std::error_code& ec, asio::local::stream_protocol::socket socket) {
        if (ec == asio::error::operation_aborted || !acceptor_.is_open()) return;
        if (!ec) {
          auto connection =
              std::make_shared<SXUnixSocketConnection>(std::move(socket), options_, *this, log_);
          connections_.insert(connection);
          if (!delegate_ || !delegate_->shouldAcceptNewConnection(connection)) {
            connection->end(false);
          }
        } else {
          // Out of descriptors or memory: accepting again at once would spin, so pause first.
          SXLOG(*log_, nullptr, SXLogLevel::kError, "accept: %@", ec.message());
          auto pause = std::make_shared<asio::steady_timer>(io_, std::chrono::milliseconds(100));
          pause->async_wait([this, pause](const std::error_code&) { accept(); });
          return;
        }
        accept();
      });
}
