#include "linux/UnixSocketIpc.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <asio/write.hpp>
#include <thread>

#include "platform/DiscardLog.h"
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
        partialFrameTimeout_(options.partialFrameTimeout),
        requestQueue_(options.requestQueue),
        budget_(std::make_shared<SXByteBudget>(options.maxConnectionBytes, listener.pool(),
                                               SXUnixSocketListener::kConnectionFloorBytes)),
        partialTimer_(socket_.get_executor()),
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
  void resume() override {
    std::weak_ptr<SXUnixSocketConnection> weak = shared_from_this();
    budget_->setWaker([weak] {
      if (auto self = weak.lock()) {
        asio::post(self->socket_.get_executor(), [self] { self->resumeIfAllowed(); });
      }
    });
    serve();
  }
  std::shared_ptr<SXByteBudget> budget() const override { return budget_; }

  // Any thread. Encodes straight into the pending output, which is written in one go: by the
  // request queue behind a batch of requests, else by the I/O thread.
  void send(uint32_t msgid, const SXValue& error, const SXValue& result) {
    bool startWriting = false;
    {
      SXMutexLock lock(outMutex_);
      if (closed_) return;
      size_t before = outPending_.size();
      RpcEncodeResponse(outPending_, msgid, error, result);
      pendingReplyBytes_.fetch_add(outPending_.size() - before);
      // A reply made by a request's task on the request queue, with a marker on its way behind
      // it, is written by that marker (writeReplies). Replies made elsewhere go out at once.
      const bool markerWrites =
          markerPending_.load() && std::this_thread::get_id() == requestQueueThread_.load();
      startWriting = !writing_ && !markerWrites;
      if (startWriting) writing_ = true;
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
      SXMutexLock lock(outMutex_);
      closed_ = true;
    }
    std::error_code ignored;
    partialTimer_.cancel();
    socket_.shutdown(asio::socket_base::shutdown_both, ignored);
    socket_.close(ignored);
    chargeBuffered(0);
    if (interrupted && interruption_) std::exchange(interruption_, nullptr)();
    if (invalidation_) std::exchange(invalidation_, nullptr)();
    exported_.reset();
    listener_.connectionClosed(shared_from_this());
  }

 private:
  void read(size_t size) {
    char* buffer = decoder_.prepare(size);
    socket_.async_read_some(asio::buffer(buffer, size),
                            [self = shared_from_this()](const std::error_code& ec, size_t n) {
                              // Once the listener stops reading, a client that goes away
                              // is noticed when the connections are closed.
                              bool stopped = !self->ended_ && !self->listener_.reading();
                              if (ec && !stopped) {
                                self->end(ec != asio::error::eof);
                                return;
                              }
                              self->decoder_.commit(n);
                              self->chargeBuffered(self->decoder_.bufferedBytes());
                              self->serve();
                            });
  }

  // How much may be read now. While the pool is full only a connection that holds less than
  // the floor reads, and only up to it.
  size_t readAllowance() const {
    if (!listener_.reading()) return 0;
    if (!budget_->poolOverLimit()) {
      // Bytes read become at most 8 times as many bytes of charges (a 64-byte send request
      // holds 512), so near its own limit or the pool's a connection reads less, and what one
      // read adds stays within 8 x kMinRead of them. kMinRead lets a partly received request
      // complete.
      auto room = [](const SXByteBudget& budget) {
        return budget.held() < budget.limit() ? budget.limit() - budget.held() : 0;
      };
      uint64_t free = room(*budget_);
      if (const auto& pool = budget_->pool()) free = std::min(free, room(*pool));
      return static_cast<size_t>(std::clamp<uint64_t>(free / 8, kMinRead, kReadSize));
    }
    uint64_t held = budget_->held() + bufferedCharged_;
    uint64_t floor = budget_->floor();
    return held < floor ? static_cast<size_t>(floor - held) : 0;
  }

  // Keeps the pool's count of this connection's partly received request at `bytes`. Charged to
  // the pool alone: a request must be able to complete whatever the connection holds.
  void chargeBuffered(uint64_t bytes) {
    const auto& pool = budget_->pool();
    if (!pool) return;
    if (bytes > bufferedCharged_) pool->add(bytes - bufferedCharged_);
    if (bytes < bufferedCharged_) pool->release(bufferedCharged_ - bytes);
    bufferedCharged_ = bytes;
  }

  // I/O thread: hands on the requests already buffered, then reads more once they are all
  // handed on, unless back-pressure says to wait.
  void serve() {
    for (;;) {
      Dispatched dispatched = dispatchMessages();
      if (dispatched == Dispatched::kEnded) return;
      watchPartialFrame();
      if (!mustWait()) {
        // Room was made while dispatching stopped: whole requests may still be buffered, and
        // the client may have nothing more to send, so those go first.
        if (dispatched != Dispatched::kDrained) continue;
        if (size_t allowance = readAllowance()) {
          read(allowance);
          return;
        }
      }
      paused_.store(true);
      if (armWakesAndMustWait() || (dispatched == Dispatched::kDrained && readAllowance() == 0)) {
        listener_.connectionPaused();
        return;
      }
      paused_.store(false);
    }
  }

  // I/O thread: a request that has begun to arrive must be complete within the timeout. A
  // request completed meanwhile, or back-pressure of the connection's own making, starts the
  // wait again.
  void watchPartialFrame() {
    if (timerArmed_ || ended_ || partialFrameTimeout_.count() <= 0) return;
    if (decoder_.bufferedBytes() == 0) return;
    timerArmed_ = true;
    timerMark_ = completedMessages_;
    partialTimer_.expires_after(partialFrameTimeout_);
    partialTimer_.async_wait(
        [self = shared_from_this()](const std::error_code& ec) { self->partialFrameDue(ec); });
  }

  void partialFrameDue(const std::error_code& ec) {
    timerArmed_ = false;
    if (ec || ended_ || decoder_.bufferedBytes() == 0) return;
    if (completedMessages_ != timerMark_ || mustWait()) {
      watchPartialFrame();
      return;
    }
    SXLOG(*log_, nullptr, SXLogLevel::kError,
          "closing %@: a request of which %llu bytes have arrived was not completed within "
          "%lli ms",
          description(), static_cast<unsigned long long>(decoder_.bufferedBytes()),
          static_cast<int64_t>(partialFrameTimeout_.count()));
    listener_.partialFrameTimedOut();
    end(true);
  }

  // Room may be made between a test and the arming: look again after arming, so that a
  // wake-up is never missed.
  bool armWakesAndMustWait() {
    budget_->armWake();
    if (const auto& pool = budget_->pool()) pool->armWake();
    return mustWait();
  }

  bool mustWait() const {
    return queued_.load() >= maxQueuedRequests_ ||
           pendingReplyBytes_.load() > maxPendingReplyBytes_ || budget_->overLimit();
  }

 public:
  // I/O thread, after a marker ran, a write finished or budget was released. A wake-up is
  // spent once it fires, and the pool may have filled again before this runs: a connection
  // that must go on waiting arms its wake-ups again, or no later release would resume it.
  void resumeIfAllowed() {
    if (ended_ || !paused_.load() || armWakesAndMustWait()) return;
    paused_.store(false);
    serve();
  }

 private:
  enum class Dispatched { kDrained, kStopped, kEnded };

  // Hands every whole message to the exported object, stopping early when back-pressure
  // says wait. kDrained: no whole message is left; kStopped: back-pressure stopped it with
  // messages left; kEnded: the stream broke or the connection ended.
  Dispatched dispatchMessages() {
    SXCoalescedWakes wakeOnce;  // the server queue wakes once for this read's requests
    const msgpack::object* message = nullptr;
    bool ok = true;
    bool drained = false;
    while (ok && !ended_ && !mustWait()) {
      if (dispatchInPlace()) continue;
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
        ++completedMessages_;
        ok = dispatch(*message);
      }
    }
    decoder_.shrinkIfIdle();
    chargeBuffered(decoder_.bufferedBytes());
    coverDispatched();
    if (!ok) end(true);
    if (!ok || ended_) return Dispatched::kEnded;
    return drained ? Dispatched::kDrained : Dispatched::kStopped;
  }

  bool dispatch(const msgpack::object& message) {
    std::string why;
    std::optional<uint32_t> msgid;
    auto request = RpcParseRequest(message, why, msgid);
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
    handOn(decoder_.lastMessageBytes(), [&] {
      exported_->handleRequest(request->method, *request->params, decoder_.lastMessageBytes(),
                               replyTo(request->msgid));
      return true;
    });
    return true;
  }

  // I/O thread: the request at the head of the stream, read in place when the exported object
  // takes it that way (a send, the bulk of what clients ask); false, and it is decoded.
  bool dispatchInPlace() {
    if (!exported_) return false;
    std::optional<RpcPackedRequest> request = decoder_.peekRequest();
    if (!request) return false;
    SXIpcReplyFn reply = replyTo(request->msgid);
    if (!handOn(request->bytes, [&] {
          return exported_->handlePackedRequest(request->method, request->params, request->bytes,
                                                reply);
        })) {
      return false;
    }
    decoder_.skipRequest(*request);
    ++completedMessages_;
    return true;
  }

  SXIpcReplyFn replyTo(uint32_t msgid) {
    std::weak_ptr<SXUnixSocketConnection> weak = shared_from_this();
    return [weak, msgid](const SXValue& error, const SXValue& result) {
      if (auto self = weak.lock()) self->send(msgid, error, result);
    };
  }

  // Hands a request of `wireBytes` on with `handle`, which says whether it was taken. What
  // it holds counts against the budgets until its work has run.
  template <typename Handle>
  bool handOn(size_t wireBytes, Handle&& handle) {
    uint64_t cost = SXDecodedBytes(wireBytes);
    budget_->add(cost);
    if (requestQueue_) queued_.fetch_add(1);
    bool taken = handle();
    if (!taken || !requestQueue_) {
      budget_->release(cost);
      if (!taken && requestQueue_) queued_.fetch_sub(1);
      return taken;
    }
    // Counted as uncovered only now that its work is on the queue: a marker posted from the
    // queue thread at this moment must not overtake it.
    uncoveredBytes_.fetch_add(cost);
    uncovered_.fetch_add(1);
    return true;
  }

  // Any thread: posts a marker behind the requests handed on since the last one, unless a
  // marker is already on its way (it posts the next one when it runs).
  void coverDispatched() {
    if (!requestQueue_ || uncovered_.load() == 0 || markerPending_.exchange(true)) return;
    uint64_t covered = uncovered_.exchange(0);
    uint64_t bytes = uncoveredBytes_.exchange(0);
    std::weak_ptr<SXUnixSocketConnection> weak = shared_from_this();
    // The budget is released even when the connection has gone, since the pool counts it too.
    requestQueue_->async([weak, budget = budget_, covered, bytes] {
      budget->release(bytes);
      if (auto self = weak.lock()) self->requestsHandled(covered);
    });
  }

  // On the request queue: every request covered by this marker has been handled.
  void requestsHandled(uint64_t covered) {
    requestQueueThread_.store(std::this_thread::get_id());
    queued_.fetch_sub(covered);
    markerPending_.store(false);
    writeReplies();
    coverDispatched();
    if (paused_.load()) {
      asio::post(socket_.get_executor(), [self = shared_from_this()] { self->resumeIfAllowed(); });
    }
  }

  // On the request queue: writes the replies gathered for the batch just handled straight to
  // the socket, which saves waking the I/O thread for them. What the socket does not take at
  // once, or a failure, is left to the I/O thread.
  void writeReplies() {
    {
      SXMutexLock lock(outMutex_);
      if (closed_ || writing_ || outPending_.empty()) return;
      ssize_t sent =
          ::send(fd_, outPending_.data(), outPending_.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
      if (sent > 0) {
        outPending_.erase(0, static_cast<size_t>(sent));
        pendingReplyBytes_.fetch_sub(static_cast<size_t>(sent));
      }
      if (outPending_.empty()) return;
      writing_ = true;
    }
    asio::post(socket_.get_executor(), [self = shared_from_this()] { self->write(); });
  }

  void write() {
    {
      SXMutexLock lock(outMutex_);
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
  static constexpr size_t kMinRead = 4 * 1024;

  asio::local::stream_protocol::socket socket_;
  RpcStreamDecoder decoder_;  // I/O thread only
  const size_t maxQueuedRequests_;
  const size_t maxPendingReplyBytes_;
  const std::chrono::milliseconds partialFrameTimeout_;
  const std::shared_ptr<SXWorkQueue> requestQueue_;
  const std::shared_ptr<SXByteBudget> budget_;
  asio::steady_timer partialTimer_;  // I/O thread only
  bool timerArmed_ = false;          // I/O thread only
  uint64_t completedMessages_ = 0;   // I/O thread only
  uint64_t timerMark_ = 0;           // I/O thread only: completedMessages_ when the timer was set
  uint64_t bufferedCharged_ = 0;     // I/O thread only: partly received bytes charged to the pool
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
  std::atomic<uint64_t> uncovered_{0};               // handed on, no marker posted behind them yet
  std::atomic<uint64_t> uncoveredBytes_{0};          // their budget charge
  std::atomic<bool> markerPending_{false};           // a marker is on the request queue
  std::atomic<std::thread::id> requestQueueThread_;  // where the last marker ran
  std::atomic<bool> paused_{false};                  // set by the I/O thread, read by markers
  std::atomic<size_t> pendingReplyBytes_{0};         // outPending_ plus outFlight_
  SXMutex outMutex_;
  std::string outPending_ SX_GUARDED_BY(outMutex_);
  bool writing_ SX_GUARDED_BY(outMutex_) = false;
  bool closed_ SX_GUARDED_BY(outMutex_) = false;
  std::string outFlight_;  // I/O thread only, while a write is in flight
};

SXUnixSocketListener::SXUnixSocketListener(Options options, std::shared_ptr<SXLogFacility> log)
    : options_(std::move(options)),
      log_(SXLogOrDiscard(std::move(log))),
      acceptor_(io_),
      pool_(std::make_shared<SXByteBudget>(options_.maxInflightBytes)),
      wakeTarget_(std::make_shared<WakeTarget>()) {
  wakeTarget_->listener = this;
  pool_->setWaker([target = wakeTarget_] {
    SXMutexLock lock(target->mutex);
    if (auto* listener = target->listener) {
      asio::post(listener->io_, [listener] { listener->resumePaused(); });
    }
  });
}

SXUnixSocketListener::~SXUnixSocketListener() {
  SXMutexLock lock(wakeTarget_->mutex);
  wakeTarget_->listener = nullptr;
}

void SXUnixSocketListener::resumePaused() {
  auto live = connections_;
  for (const auto& connection : live) connection->resumeIfAllowed();
}

SXStatus SXUnixSocketListener::open() {
  std::error_code ec;
  // Clears LISTEN_FDS and LISTEN_PID, so that nothing this process starts takes them as its own.
  int passed = sd_listen_fds(1);
  if (passed < 0) return SXErrnoStatus("sd_listen_fds", -passed);
  if (passed > 0) {
    if (passed != 1 || sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) <= 0) {
      return SXFailure("the service manager passed " + std::to_string(passed) +
                       " descriptors; expected one listening Unix stream socket");
    }
    acceptor_.assign(asio::local::stream_protocol(), SD_LISTEN_FDS_START, ec);
    if (ec) {
      return SXFailure("cannot adopt the socket passed by the service manager: " + ec.message());
    }
    activated_ = true;
    return {};
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
  if (ec) return SXFailure(options_.socketPath + ": " + ec.message());
  // The umask can only take bits away, so the exact mode (perhaps wider than the umask) is set
  // here; until then the socket is at most as open as the mode.
  if (::chmod(options_.socketPath.c_str(), static_cast<mode_t>(options_.socketMode)) != 0) {
    return SXErrnoStatus(options_.socketPath, errno);
  }
  return {};
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

void SXUnixSocketListener::stopReading() {
  // A read in progress completes when its bytes come; the requests they finish are still
  // handed on, and no further read is started.
  reading_ = false;
  std::error_code ignored;
  acceptor_.close(ignored);
}

size_t SXUnixSocketListener::closeConnections() {
  auto live = connections_;
  for (const auto& connection : live) connection->end(false);
  return live.size();
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
