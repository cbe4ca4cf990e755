#include "fakes/FakeRpcServer.h"

#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <stdexcept>

#include "common/RpcCodec.h"

FakeRpcServer::FakeRpcServer() {
  std::string pattern = (std::filesystem::temp_directory_path() / "sxr-fake-XXXXXX").string();
  if (!::mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp failed");
  directory_ = pattern;
  socketPath_ = directory_ + "/rpc.sock";
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath_.c_str(), sizeof address.sun_path - 1);
  listener_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (::bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener_, 64) != 0) {
    throw std::runtime_error("cannot listen on " + socketPath_);
  }
  acceptor_ = std::thread([this] { acceptLoop(); });
}

FakeRpcServer::~FakeRpcServer() {
  ::shutdown(listener_, SHUT_RDWR);  // ends the accept loop
  acceptor_.join();
  ::close(listener_);
  closeConnections();  // ends every read loop
  std::vector<std::thread> readers;
  {
    SXMutexLock lock(mutex_);
    readers.swap(readers_);
  }
  for (auto& reader : readers) reader.join();
  SXMutexLock lock(mutex_);
  for (const auto& connection : connections_) ::close(connection.fd);
  std::error_code ignored;
  std::filesystem::remove_all(directory_, ignored);
}

void FakeRpcServer::acceptLoop() {
  for (;;) {
    int fd = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0 && errno == EINTR) continue;
    if (fd < 0) return;
    SXMutexLock lock(mutex_);
    connections_.push_back({fd, true});
    readers_.emplace_back([this, fd] { readLoop(fd); });
  }
}

void FakeRpcServer::readLoop(int fd) {
  RpcStreamDecoder decoder;
  for (;;) {
    ssize_t n = ::read(fd, decoder.prepare(4096), 4096);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    decoder.commit(n);
    SXValue message;
    RpcStreamDecoder::Status status;
    while ((status = decoder.next(message)) == RpcStreamDecoder::Status::kMessage) {
      std::string why;
      std::optional<uint32_t> msgid;
      auto request = RpcParseRequest(message, why, msgid);
      if (!request) continue;
      Handler handler;
      {
        SXMutexLock lock(mutex_);
        requests_.push_back({request->msgid, request->method, request->params});
        if (auto it = handlers_.find(request->method); it != handlers_.end()) handler = it->second;
      }
      changed_.notify_all();
      Answer answer =
          handler ? handler(request->params) : Answer::fail("unknown method " + request->method);
      if (answer.withhold) continue;
      std::string bytes;
      RpcEncodeResponse(bytes, request->msgid, answer.error, answer.result);
      SXMutexLock lock(mutex_);  // not to interleave with respond() and sendBytes()
      sendTo(fd, bytes);
    }
    if (status == RpcStreamDecoder::Status::kBroken) break;
  }
  SXMutexLock lock(mutex_);
  for (auto& connection : connections_) {
    if (connection.fd == fd) connection.open = false;
  }
}

void FakeRpcServer::sendTo(int fd, const std::string& bytes) {
  for (size_t sent = 0; sent < bytes.size();) {
    ssize_t n = ::send(fd, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;  // the connection is gone
    sent += n;
  }
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
  return connections_.size();
}

void FakeRpcServer::respond(uint32_t msgid, const SXValue& error, const SXValue& result) {
  std::string bytes;
  RpcEncodeResponse(bytes, msgid, error, result);
  sendBytes(bytes);
}

void FakeRpcServer::sendBytes(const std::string& bytes) {
  SXMutexLock lock(mutex_);
  for (const auto& connection : connections_) {
    if (connection.open) sendTo(connection.fd, bytes);
  }
}

void FakeRpcServer::closeConnections() {
  SXMutexLock lock(mutex_);
  for (auto& connection : connections_) {
    if (connection.open) ::shutdown(connection.fd, SHUT_RDWR);
    connection.open = false;
  }
}
