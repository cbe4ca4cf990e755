#include "client/SXRpcChannel.h"

#include <algorithm>
#include <vector>

namespace {

// Replies may be much larger than requests (the status of a busy service, every reporter ID),
// so the client accepts more than the service does.
RpcLimits replyLimits() {
  RpcLimits limits;
  limits.maxMessageBytes = 64u << 20;
  limits.maxPayloadDepth = 64;
  limits.maxContainerEntries = 1u << 24;
  return limits;
}

constexpr size_t kReadChunk = 64 * 1024;
// Longer than this counts as no time-out, so that adding it to a time point cannot overflow.
constexpr auto kLongestTimeout = std::chrono::hours(24 * 365 * 100);

std::string durationText(std::chrono::milliseconds timeout) {
  if (timeout.count() % 1000 == 0) return std::to_string(timeout.count() / 1000) + " s";
  return std::to_string(timeout.count()) + " ms";
}

std::string errorText(const SXValue& error) {
  if (error.is_string()) return error.get<std::string>();
  return error.dump(-1, ' ', false, SXValue::error_handler_t::replace);
}

}  // namespace

SXRpcChannel::SXRpcChannel(std::string socketPath, std::chrono::milliseconds defaultTimeout)
    : socketPath_(std::move(socketPath)),
      defaultTimeout_(defaultTimeout),
      work_(asio::make_work_guard(io_)),
      socket_(io_),
      timer_(io_),
      decoder_(replyLimits()) {}

void SXRpcChannel::run() { io_.run(); }

void SXRpcChannel::shutdown() {
  asio::post(io_, [this] {
    fail("the client closed the connection");
    work_.reset();
  });
}

bool SXRpcChannel::connect(std::string* error) {
  std::promise<std::string> result;
  {
    SXMutexLock lock(mutex_);
    if (state_ != State::kIdle) {
      if (state_ == State::kConnected) return true;
      if (error) *error = closeReason_.empty() ? "already connecting" : closeReason_;
      return false;
    }
    state_ = State::kConnecting;
  }
  asio::post(io_, [this, &result] {
    try {
      socket_.async_connect(
          asio::local::stream_protocol::endpoint(socketPath_),
          [this, &result](const asio::error_code& ec) { onConnected(ec, result); });
    } catch (const std::exception&) {  // a path too long for a socket address
      onConnected(asio::error::invalid_argument, result);
    }
  });
  std::string why = result.get_future().get();
  if (!why.empty() && error) *error = why;
  return why.empty();
}

void SXRpcChannel::onConnected(const asio::error_code& ec, std::promise<std::string>& result) {
  std::string why;
  {
    SXMutexLock lock(mutex_);
    if (state_ != State::kConnecting) {
      why = closeReason_;
    } else if (ec) {
      why = "cannot connect to " + socketPath_ + ": " + ec.message();
      state_ = State::kClosed;
      closeReason_ = why;
    } else {
      state_ = State::kConnected;
    }
  }
  if (why.empty()) startRead();
  result.set_value(why);
}

void SXRpcChannel::close() {
  asio::post(io_, [this] { fail("the client closed the connection"); });
}

bool SXRpcChannel::connected() const {
  SXMutexLock lock(mutex_);
  return state_ == State::kConnected;
}

void SXRpcChannel::call(std::string_view method, const SXValue& params, SXTimeout timeout,
                        Completion done) {
  const auto limit = timeout.value_or(defaultTimeout_);
  const bool hasDeadline = limit < kLongestTimeout;
  const auto deadline = hasDeadline ? Clock::now() + limit : Clock::time_point::max();

  SXMutexLock lock(mutex_);
  if (state_ != State::kConnected) {
    std::string why = closeReason_.empty() ? "not connected" : closeReason_;
    lock.unlock();
    asio::post(io_, [done = std::move(done), why = std::move(why)] {
      complete(done, {SXCallStatus::kConnectionLost, nullptr, why});
    });
    return;
  }
  while (pending_.contains(nextMsgid_)) ++nextMsgid_;  // only after 2^32 calls
  const uint32_t msgid = nextMsgid_++;
  RpcEncodeRequest(outbox_, msgid, method, params);
  Pending& pending = pending_[msgid];
  pending.done = std::move(done);
  pending.timeout = limit;
  pending.hasDeadline = hasDeadline;
  const bool rearm = hasDeadline && deadline < timerArmedFor_;
  if (hasDeadline) pending.deadline = deadlines_.emplace(deadline, msgid);
  if (rearm) timerArmedFor_ = deadline;
  const bool startWrite = !writeScheduled_;
  writeScheduled_ = true;
  lock.unlock();

  if (startWrite) asio::post(io_, [this] { flush(); });
  if (rearm) asio::post(io_, [this] { armTimer(); });
}

// Hands everything queued so far to one write; calls made while it is in flight wait for the
// next one, so a burst of calls costs few system calls.
void SXRpcChannel::flush() {
  {
    SXMutexLock lock(mutex_);
    if (outbox_.size() == 0 || state_ != State::kConnected) {
      writeScheduled_ = false;
      return;
    }
    std::swap(outbox_, writing_);
    outbox_.clear();
  }
  asio::async_write(socket_, asio::buffer(writing_.data(), writing_.size()),
                    [this](const asio::error_code& ec, size_t) {
                      if (ec) {
                        fail("cannot write to the service: " + ec.message());
                        return;
                      }
                      flush();
                    });
}

void SXRpcChannel::startRead() {
  char* buffer = decoder_.prepare(kReadChunk);
  socket_.async_read_some(
      asio::buffer(buffer, kReadChunk), [this](const asio::error_code& ec, size_t size) {
        if (ec) {
          fail(ec == asio::error::eof ? "the service closed the connection"
                                      : "connection to the service lost: " + ec.message());
          return;
        }
        decoder_.commit(size);
        if (drainReplies()) startRead();
      });
}

bool SXRpcChannel::drainReplies() {
  SXValue message;
  for (;;) {
    switch (decoder_.next(message)) {
      case RpcStreamDecoder::Status::kMessage:
        handleMessage(message);
        break;
      case RpcStreamDecoder::Status::kNeedMore:
        return true;
      case RpcStreamDecoder::Status::kBroken:
        fail("the service sent bytes that are not MessagePack-RPC: " + decoder_.error());
        return false;
    }
  }
}

// Anything that is not a response to a pending call (a late reply to a timed-out call, a
// request, a stray value) is dropped: the stream itself is still sound.
void SXRpcChannel::handleMessage(const SXValue& message) {
  auto response = RpcParseResponse(message);
  if (!response) return;
  Completion done;
  {
    SXMutexLock lock(mutex_);
    auto it = pending_.find(response->msgid);
    if (it == pending_.end()) return;
    done = std::move(it->second.done);
    forget(it->second);
    pending_.erase(it);
  }
  if (response->error.is_null()) {
    complete(done, {SXCallStatus::kReplied, std::move(response->result), {}});
  } else {
    complete(done, {SXCallStatus::kRemoteError, nullptr, errorText(response->error)});
  }
}

void SXRpcChannel::forget(Pending& pending) {
  if (pending.hasDeadline) deadlines_.erase(pending.deadline);
}

void SXRpcChannel::armTimer() {
  Clock::time_point next;
  {
    SXMutexLock lock(mutex_);
    next = deadlines_.empty() ? Clock::time_point::max() : deadlines_.begin()->first;
    timerArmedFor_ = next;
  }
  if (next == Clock::time_point::max()) {
    timer_.cancel();
    return;
  }
  timer_.expires_at(next);
  timer_.async_wait([this](const asio::error_code& ec) {
    if (!ec) expireCalls();
  });
}

void SXRpcChannel::expireCalls() {
  std::vector<std::pair<Completion, std::chrono::milliseconds>> expired;
  {
    SXMutexLock lock(mutex_);
    const auto now = Clock::now();
    while (!deadlines_.empty() && deadlines_.begin()->first <= now) {
      auto it = pending_.find(deadlines_.begin()->second);
      deadlines_.erase(deadlines_.begin());
      if (it == pending_.end()) continue;
      expired.emplace_back(std::move(it->second.done), it->second.timeout);
      pending_.erase(it);
    }
  }
  for (auto& [done, timeout] : expired) {
    complete(done, {SXCallStatus::kTimedOut, nullptr, "no reply within " + durationText(timeout)});
  }
  armTimer();
}

void SXRpcChannel::fail(const std::string& reason) {
  std::vector<std::pair<uint32_t, Completion>> pending;
  {
    SXMutexLock lock(mutex_);
    if (state_ == State::kClosed) return;
    state_ = State::kClosed;
    closeReason_ = reason;
    for (auto& [msgid, call] : pending_) pending.emplace_back(msgid, std::move(call.done));
    pending_.clear();
    deadlines_.clear();
    outbox_.clear();
    timerArmedFor_ = Clock::time_point::max();
  }
  asio::error_code ignored;
  socket_.close(ignored);
  timer_.cancel();
  // In the order the calls were made, which is what a caller waiting on several expects.
  std::sort(pending.begin(), pending.end(),
            [](const auto& a, const auto& b) { return a.first < b.first; });
  for (auto& [msgid, done] : pending) {
    complete(done, {SXCallStatus::kConnectionLost, nullptr, reason});
  }
}

// A callback that throws must not take the I/O thread (and every other call) down with it.
void SXRpcChannel::complete(const Completion& done, SXCallResult<SXValue> result) {
  try {
    done(std::move(result));
  } catch (...) {
  }
}
