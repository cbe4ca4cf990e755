#include "PipelinedRpcClient.h"

#include <sys/socket.h>

#include <asio/write.hpp>
#include <sstream>

namespace {

constexpr size_t kReadChunk = 64 * 1024;
// Stop encoding once this much waits for the socket, so a large window still writes early.
constexpr size_t kMaxBatchBytes = 256 * 1024;

std::string describe(const msgpack::object& object) {
  std::ostringstream text;
  text << object;
  return text.str();
}

bool isTrue(const msgpack::object& object) {
  return object.type == msgpack::type::BOOLEAN && object.via.boolean;
}

}  // namespace

PipelinedRpcClient::PipelinedRpcClient(asio::io_context& io, size_t window, bool checkResults)
    : socket_(io), window_(window == 0 ? 1 : window), checkResults_(checkResults) {}

bool PipelinedRpcClient::connect(const std::string& socketPath, std::string& error) {
  asio::error_code ec;
  socket_.connect(asio::local::stream_protocol::endpoint(socketPath), ec);
  if (ec) {
    error = "cannot connect to " + socketPath + ": " + ec.message();
    return false;
  }
  return true;
}

pid_t PipelinedRpcClient::peerPid() {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket_.native_handle(), SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) {
    return -1;
  }
  return credentials.pid;
}

void PipelinedRpcClient::runPhase(RequestSource source, bool awaitAll, std::function<void()> done) {
  source_ = std::move(source);
  awaitAll_ = awaitAll;
  done_ = std::move(done);
  if (failed()) {
    fail(error_);
    return;
  }
  if (!reading_) {
    reading_ = true;
    readSome();
  }
  pump();
}

void PipelinedRpcClient::abort(const std::string& why) { fail(why); }

void PipelinedRpcClient::close() {
  asio::error_code ignored;
  socket_.close(ignored);
}

void PipelinedRpcClient::readSome() {
  unpacker_.reserve_buffer(kReadChunk);
  socket_.async_read_some(
      asio::buffer(unpacker_.buffer(), unpacker_.buffer_capacity()),
      [this](const asio::error_code& ec, size_t size) {
        if (ec) {
          if (ec != asio::error::operation_aborted) {
            fail(ec == asio::error::eof ? "the server closed the connection" : ec.message());
          }
          return;
        }
        unpacker_.buffer_consumed(size);
        try {
          msgpack::object_handle handle;
          while (!failed() && unpacker_.next(handle)) handleReply(handle.get());
        } catch (const std::exception& e) {
          fail(std::string("malformed reply: ") + e.what());
        }
        if (failed()) return;
        pump();
        readSome();
      });
}

void PipelinedRpcClient::handleReply(const msgpack::object& reply) {
  const auto now = std::chrono::steady_clock::now();
  if (reply.type != msgpack::type::ARRAY || reply.via.array.size != 4 ||
      reply.via.array.ptr[0].type != msgpack::type::POSITIVE_INTEGER ||
      reply.via.array.ptr[0].via.u64 != 1 ||
      reply.via.array.ptr[1].type != msgpack::type::POSITIVE_INTEGER) {
    fail("not a MessagePack-RPC response: " + describe(reply));
    return;
  }
  const msgpack::object* fields = reply.via.array.ptr;
  auto found = inflight_.find(static_cast<uint32_t>(fields[1].via.u64));
  if (found == inflight_.end()) {
    fail("response to a msgid never sent: " + describe(reply));
    return;
  }
  const InFlight request = found->second;
  inflight_.erase(found);
  replies_.fetch_add(1, std::memory_order_relaxed);
  if (request.windowed) --windowed_;
  bool served = fields[2].type == msgpack::type::NIL;
  if (served && checkResults_) {
    if (request.expect == BenchExpect::kNil) served = fields[3].type == msgpack::type::NIL;
    if (request.expect == BenchExpect::kTrue) served = isTrue(fields[3]);
  }
  if (!served) {
    if (rejected_++ == 0) firstRejection_ = "unexpected response " + describe(reply);
  }
  if (request.measured) {
    latency_.record(static_cast<uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(now - request.sent).count()));
    measuredReplies_.fetch_add(1, std::memory_order_relaxed);
  }
}

void PipelinedRpcClient::pump() {
  if (failed()) return;
  fill();
  flush();
  checkDone();
}

void PipelinedRpcClient::fill() {
  if (!source_) return;
  const auto now = std::chrono::steady_clock::now();
  msgpack::packer<ByteSink> packer(out_);
  while (windowed_ < window_ && out_.bytes.size() < kMaxBatchBytes) {
    request_.params.bytes.clear();
    request_.windowed = true;
    request_.measured = false;
    request_.expect = BenchExpect::kAnything;
    if (!source_(request_)) {
      source_ = nullptr;
      return;
    }
    uint32_t msgid = nextMsgid_++;
    const std::string& method = *request_.method;
    packer.pack_array(4);
    packer.pack_uint8(0);
    packer.pack_uint32(msgid);
    packer.pack_str(static_cast<uint32_t>(method.size()));
    packer.pack_str_body(method.data(), static_cast<uint32_t>(method.size()));
    out_.bytes += request_.params.bytes;
    inflight_[msgid] = {now, request_.windowed, request_.measured, request_.expect};
    if (request_.windowed) ++windowed_;
  }
}

void PipelinedRpcClient::flush() {
  if (writeActive_ || out_.bytes.empty()) return;
  writing_.swap(out_.bytes);
  out_.bytes.clear();
  writeActive_ = true;
  asio::async_write(socket_, asio::buffer(writing_), [this](const asio::error_code& ec, size_t) {
    writeActive_ = false;
    writing_.clear();
    if (ec) {
      if (ec != asio::error::operation_aborted) fail(ec.message());
      return;
    }
    pump();
  });
}

void PipelinedRpcClient::checkDone() {
  if (!done_ || source_ || windowed_ > 0 || (awaitAll_ && !inflight_.empty())) return;
  auto done = std::move(done_);
  done_ = nullptr;
  done();
}

void PipelinedRpcClient::fail(const std::string& why) {
  if (error_.empty()) error_ = why.empty() ? "connection failed" : why;
  close();
  source_ = nullptr;
  if (done_) {
    auto done = std::move(done_);
    done_ = nullptr;
    done();
  }
}
