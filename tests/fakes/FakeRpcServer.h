// A stand-in for the service on a Unix socket in a temporary directory, driven by the test
// itself, for what the real daemon never does: replies of the wrong shape, replies to requests
// never made, bytes that are not MessagePack-RPC. It serves the first connection only.
#pragma once

#include <memory>
#include <string>

#include "support/RawSocket.h"
#include "support/SqliteTestSupport.h"

class FakeRpcServer {
 public:
  FakeRpcServer() : listener_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path_.c_str());
    if (::bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listener_, 8) != 0) {
      ADD_FAILURE() << "cannot listen on " << path_;
    }
  }
  ~FakeRpcServer() { ::close(listener_); }
  FakeRpcServer(const FakeRpcServer&) = delete;
  FakeRpcServer& operator=(const FakeRpcServer&) = delete;

  const std::string& socketPath() const { return path_; }

  // The next request the client sent; a failure, and method "none", when none came.
  RpcRequest next() {
    if (!peer_) peer_ = std::make_unique<SXTestRawClient>(::accept(listener_, nullptr, nullptr));
    SXValue message;
    std::string why = "none";
    std::optional<uint32_t> msgid;
    if (!peer_->next(message)) ADD_FAILURE() << "no request came";
    return RpcParseRequest(message, why, msgid).value_or(RpcRequest{0, why, nullptr});
  }
  void reply(uint32_t msgid, const SXValue& error, const SXValue& result) {
    std::string bytes;
    RpcEncodeResponse(bytes, msgid, error, result);
    peer_->send(bytes);
  }
  void send(const std::string& bytes) { peer_->send(bytes); }

 private:
  SXTestTempDir dir_;
  const std::string path_ = dir_.file("rpc.sock");
  int listener_;
  std::unique_ptr<SXTestRawClient> peer_;
};
