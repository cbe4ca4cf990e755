#include "EchoServer.h"

#include <pthread.h>
#include <time.h>
#include <unistd.h>

#include <asio/post.hpp>
#include <asio/write.hpp>
#include <cstdio>
#include <memory>
#include <msgpack.hpp>

#include "PipelinedRpcClient.h"

// One client: reads requests, packs a nil reply for each, writes replies in batches.
class EchoServer::Connection : public std::enable_shared_from_this<Connection> {
 public:
  explicit Connection(asio::local::stream_protocol::socket socket) : socket_(std::move(socket)) {}

  void readSome() {
    unpacker_.reserve_buffer(64 * 1024);
    socket_.async_read_some(asio::buffer(unpacker_.buffer(), unpacker_.buffer_capacity()),
                            [self = shared_from_this()](const asio::error_code& ec, size_t size) {
                              if (ec) return;  // the client left; the connection goes with it
                              self->unpacker_.buffer_consumed(size);
                              if (!self->answerAll()) return;
                              self->flush();
                              self->readSome();
                            });
  }

 private:
  // Returns false when the bytes are not requests; the connection ends then.
  bool answerAll() {
    try {
      msgpack::object_handle handle;
      msgpack::packer<ByteSink> packer(out_);
      while (unpacker_.next(handle)) {
        const msgpack::object& request = handle.get();
        if (request.type != msgpack::type::ARRAY || request.via.array.size != 4 ||
            request.via.array.ptr[1].type != msgpack::type::POSITIVE_INTEGER) {
          return false;
        }
        packer.pack_array(4);
        packer.pack_uint8(1);
        packer.pack_uint32(static_cast<uint32_t>(request.via.array.ptr[1].via.u64));
        packer.pack_nil();
        packer.pack_nil();
      }
      return true;
    } catch (const std::exception&) {
      return false;
    }
  }

  void flush() {
    if (writeActive_ || out_.bytes.empty()) return;
    writing_.swap(out_.bytes);
    out_.bytes.clear();
    writeActive_ = true;
    asio::async_write(socket_, asio::buffer(writing_),
                      [self = shared_from_this()](const asio::error_code& ec, size_t) {
                        self->writeActive_ = false;
                        self->writing_.clear();
                        if (!ec) self->flush();
                      });
  }

  asio::local::stream_protocol::socket socket_;
  msgpack::v1::unpacker unpacker_;
  ByteSink out_;
  std::string writing_;
  bool writeActive_ = false;
};

EchoServer::EchoServer() : acceptor_(io_) {}

EchoServer::~EchoServer() { stop(); }

bool EchoServer::start(const std::string& socketPath, std::string& error) {
  ::unlink(socketPath.c_str());
  asio::error_code ec;
  asio::local::stream_protocol::endpoint endpoint(socketPath);
  acceptor_.open(endpoint.protocol(), ec);
  if (!ec) acceptor_.bind(endpoint, ec);
  if (!ec) acceptor_.listen(asio::socket_base::max_listen_connections, ec);
  if (ec) {
    error = "cannot listen on " + socketPath + ": " + ec.message();
    return false;
  }
  socketPath_ = socketPath;
  accept();
  thread_ = std::thread([this] { io_.run(); });
  nativeThread_ = thread_.native_handle();
  return true;
}

std::optional<double> EchoServer::cpuSeconds() const {
  clockid_t clock;
  timespec used{};
  if (!thread_.joinable() || ::pthread_getcpuclockid(nativeThread_, &clock) != 0 ||
      ::clock_gettime(clock, &used) != 0) {
    return std::nullopt;
  }
  return static_cast<double>(used.tv_sec) + static_cast<double>(used.tv_nsec) * 1e-9;
}

void EchoServer::stop() {
  if (!thread_.joinable()) return;
  io_.stop();
  thread_.join();
  ::unlink(socketPath_.c_str());
}

void EchoServer::accept() {
  acceptor_.async_accept(
      [this](const asio::error_code& ec, asio::local::stream_protocol::socket socket) {
        if (ec) return;
        std::make_shared<Connection>(std::move(socket))->readSome();
        accept();
      });
}
