// Plain Unix-socket connections that speak the wire protocol by hand, for what the client
// library would never send, never leave unread or never pipeline so far.
#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "common/RpcCodec.h"

inline std::string SXTestRequest(uint32_t msgid, std::string_view method, const SXValue& params) {
  msgpack::sbuffer buffer;
  RpcEncodeRequest(buffer, msgid, method, params);
  return std::string(buffer.data(), buffer.size());
}

class SXTestRawClient {
 public:
  // A connection already made, e.g. one a listener accepted.
  explicit SXTestRawClient(int fd) : fd_(fd) {}
  explicit SXTestRawClient(const std::string& path) : fd_(::socket(AF_UNIX, SOCK_STREAM, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    if (::connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
      ADD_FAILURE() << "connect " << path << ": " << std::strerror(errno);
    }
  }
  ~SXTestRawClient() { ::close(fd_); }
  SXTestRawClient(const SXTestRawClient&) = delete;
  SXTestRawClient& operator=(const SXTestRawClient&) = delete;

  // Writes all of `bytes` unless the peer goes away first; blocks while the peer does not read.
  // Adds what went out to `written` as it goes.
  size_t send(std::string_view bytes, std::atomic<size_t>* written = nullptr) {
    size_t done = 0;
    while (done < bytes.size()) {
      ssize_t n = ::send(fd_, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
      if (n <= 0) break;
      done += static_cast<size_t>(n);
      if (written) *written += static_cast<size_t>(n);
    }
    return done;
  }
  void request(std::string_view method, const SXValue& params) {
    send(SXTestRequest(++msgid_, method, params));
  }
  // The next message; false when the connection ends or nothing comes for 30 s.
  bool next(SXValue& message) {
    for (;;) {
      auto status = decoder_.next(message);
      if (status == RpcStreamDecoder::Status::kMessage) return true;
      if (status == RpcStreamDecoder::Status::kBroken || !readable(30'000)) return false;
      ssize_t n = ::recv(fd_, decoder_.prepare(256 * 1024), 256 * 1024, 0);
      if (n <= 0) return false;
      decoder_.commit(static_cast<size_t>(n));
    }
  }
  // Reads until `count` responses in all have come: their msgids in arrival order, -1 for an
  // error response. Fewer when the connection ends or nothing comes for 30 s.
  std::vector<int64_t> responses(size_t count) {
    SXValue message;
    while (ids_.size() < count && next(message)) {
      auto response = RpcParseResponse(message);
      ids_.push_back(response && response->error.is_null() ? int64_t(response->msgid) : -1);
    }
    return ids_;
  }
  // True when the daemon closed the connection (EOF or reset) within 10 s.
  bool closedByPeer() {
    char buffer[4096];
    while (readable(10'000)) {
      ssize_t n = ::recv(fd_, buffer, sizeof buffer, 0);
      if (n <= 0) return n == 0 || errno == ECONNRESET;
    }
    return false;
  }
  // Leaves with a request answered but its reply unread and half of another request sent,
  // which the daemon's side sees as a reset connection in the middle of a frame.
  void abandon() {
    request(sxr::method::kGetAllReporters, SXValue::array());
    readable(10'000);
    std::string next = SXTestRequest(++msgid_, sxr::method::kGetAllReporters, SXValue::array());
    send(next.substr(0, next.size() / 2));
    ::close(std::exchange(fd_, -1));
  }

 private:
  bool readable(int timeoutMs) {
    pollfd p{fd_, POLLIN, 0};
    return ::poll(&p, 1, timeoutMs) == 1;
  }

  int fd_;
  uint32_t msgid_ = 0;
  std::vector<int64_t> ids_;
  RpcStreamDecoder decoder_{RpcLimits{.maxMessageBytes = 64 << 20}};
};
