#include "fakes/FakeRpcServer.h"

#include <stdlib.h>

#include <deque>
#include <filesystem>
#include <stdexcept>

#include "common/RpcCodec.h"

class FakeRpcServer::Connection : public std::enable_shared_from_this<Connection> {
 public:
  Connection(FakeRpcServer& server, asio::local::stream_protocol::socket socket)
      : server_(server), socket_(std::move(socket)) {}

  void read() {
    char* buffer = decoder_.prepare(4096);
    socket_.async_read_some(asio::buffer(buffer, 4096), [self = shared_from_this()](
                                                            const asio::error_code& ec, size_t n) {
      if (ec) return self->close();
      self->decoder_.commit(n);
      SXValue message;
      RpcStreamDecoder::Status status;
      while ((status = self->decoder_.next(message)) == RpcStreamDecoder::Status::kMessage) {
        self->server_.handle(self, message);
      }
      if (status == RpcStreamDecoder::Status::kBroken) return self->close();
      self->read();
    });
  }

  void send(std::string bytes) {
    outbox_.push_back(std::move(bytes));
    if (outbox_.size() == 1) writeNext();
  }

  void close() {
    asio::error_code ignored;
    socket_.close(ignored);
    server_.connections_.erase(shared_from_this());
  }

 private:
  void writeNext() {
    asio::async_write(socket_, asio::buffer(outbox_.front()),
                      [self = shared_from_this()](const asio::error_code& ec, size_t) {
                        if (ec) return self->close();
                        self->outbox_.pop_front();
                        if (!self->outbox_.empty()) self->writeNext();
                      });
  }

  FakeRpcServer& server_;
  asio::local::stream_protocol::socket socket_;
  RpcStreamDecoder decoder_;
  std::deque<std::string> outbox_;
};

namespace {

std::string makeTempDirectory() {
  std::string pattern = (std::filesystem::temp_directory_path() / "sxr-fake-XXXXXX").string();
  if (!::mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp failed");
  return pattern;
}

std::string encodeResponse(uint32_t msgid, const SXValue& error, const SXValue& result) {
  msgpack::sbuffer buffer;
  RpcEncodeResponse(buffer, msgid, error, result);
  return std::string(buffer.data(), buffer.size());
}

}  // namespace

FakeRpcServer::FakeRpcServer()
    : directory_(makeTempDirectory()),
      socketPath_(directory_ + "/rpc.sock"),
      acceptor_(io_, asio::local::stream_protocol::endpoint(socketPath_)) {
  accept();
  thread_ = std::thread([this] { io_.run(); });
}

FakeRpcServer::~FakeRpcServer() {
  io_.stop();
  thread_.join();
  std::error_code ignored;
  std::filesystem::remove_all(directory_, ignored);
}

void FakeRpcServer::accept() {
  acceptor_.async_accept(
      [this](const asio::error_code& ec, asio::local::stream_protocol::socket socket) {
        if (ec) return;
        auto connection = std::make_shared<Connection>(*this, std::move(socket));
        connections_.insert(connection);
        connection->read();
        {
          SXMutexLock lock(mutex_);
          ++connectionCount_;
        }
        changed_.notify_all();
        accept();
      });
}

void FakeRpcServer::handle(const std::shared_ptr<Connection>& connection, const SXValue& message) {
  std::string why;
  std::optional<uint32_t> msgid;
  auto request = RpcParseRequest(message, why, msgid);
  if (!request) return;
  Handler handler;
  {
    SXMutexLock lock(mutex_);
    requests_.push_back({request->msgid, request->method, request->params});
    auto it = handlers_.find(request->method);
    if (it != handlers_.end()) handler = it->second;
  }
  changed_.notify_all();
  Answer answer =
      handler ? handler(request->params) : Answer::fail("unknown method " + request->method);
  if (answer.withhold) return;
  connection->send(encodeResponse(request->msgid, answer.error, answer.result));
}

void FakeRpcServer::on(const std::string& method, Handler handler) {
  SXMutexLock lock(mutex_);
  handlers_[method] = std::move(handler);
}

std::vector<FakeRpcServer::Request> FakeRpcServer::requests() const {
  SXMutexLock lock(mutex_);
  return requests_;
}

bool FakeRpcServer::waitForRequests(size_t count, std::chrono::milliseconds timeout) {
  SXMutexLock lock(mutex_);
  return lock.waitFor(changed_, timeout,
                      [&]() SX_REQUIRES(mutex_) { return requests_.size() >= count; });
}

size_t FakeRpcServer::connectionCount() const {
  SXMutexLock lock(mutex_);
  return connectionCount_;
}

void FakeRpcServer::forEachConnection(std::function<void(Connection&)> action) {
  asio::post(io_, [this, action = std::move(action)] {
    auto connections = connections_;  // `close` changes the set
    for (const auto& connection : connections) action(*connection);
  });
}

void FakeRpcServer::respond(uint32_t msgid, const SXValue& error, const SXValue& result) {
  sendBytes(encodeResponse(msgid, error, result));
}

void FakeRpcServer::sendBytes(std::string bytes) {
  forEachConnection([bytes = std::move(bytes)](Connection& c) { c.send(bytes); });
}

void FakeRpcServer::closeConnections() {
  forEachConnection([](Connection& c) { c.close(); });
}
