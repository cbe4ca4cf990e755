// Plain Unix-socket connections that speak the wire protocol by hand, for what the client
// library would never send, never leave unread or never pipeline so far.
#pragma once

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "common/RpcCodec.h"

// A stream socket connected to `path`, or -1.
inline int SXTestConnect(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
  if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// Writes `size` bytes unless the peer goes away first (it may close while we write); blocks
// while the peer does not read. Adds what went out to `written` as it goes; returns how much.
inline size_t SXTestSend(int fd, const char* data, size_t size,
                         std::atomic<size_t>* written = nullptr) {
  size_t done = 0;
  while (done < size) {
    ssize_t n = ::send(fd, data + done, size - done, MSG_NOSIGNAL);
    if (n <= 0) break;
    done += static_cast<size_t>(n);
    if (written) *written += static_cast<size_t>(n);
  }
  return done;
}

inline std::string SXTestRequest(uint32_t msgid, std::string_view method, const SXValue& params) {
  msgpack::sbuffer buffer;
  RpcEncodeRequest(buffer, msgid, method, params);
  return std::string(buffer.data(), buffer.size());
}

// Writes the requests `encode(out, i)` appends for i in [0, count), 16 KiB at a time.
inline void SXTestWriteRequests(int fd, int count,
                                const std::function<void(msgpack::sbuffer&, int)>& encode,
                                std::atomic<size_t>* written = nullptr) {
  msgpack::sbuffer out;
  for (int i = 0; i < count; ++i) {
    encode(out, i);
    if (out.size() < 16 * 1024 && i + 1 < count) continue;
    if (SXTestSend(fd, out.data(), out.size(), written) < out.size()) return;
    out.clear();
  }
}

// Reads `count` responses; their msgids in arrival order, -1 for an error response.
inline std::vector<int64_t> SXTestReadResponseIds(int fd, int count) {
  RpcLimits limits;
  limits.maxMessageBytes = 64 << 20;
  RpcStreamDecoder decoder(limits);
  std::vector<int64_t> ids;
  SXValue message;
  while (static_cast<int>(ids.size()) < count) {
    auto status = decoder.next(message);
    if (status == RpcStreamDecoder::Status::kMessage) {
      auto response = RpcParseResponse(message);
      ids.push_back(response && response->error.is_null() ? int64_t(response->msgid) : -1);
      continue;
    }
    if (status == RpcStreamDecoder::Status::kBroken) break;
    char* buffer = decoder.prepare(256 * 1024);
    ssize_t n = ::read(fd, buffer, 256 * 1024);
    if (n <= 0) break;
    decoder.commit(static_cast<size_t>(n));
  }
  return ids;
}

// from, from + 1, ... (`count` of them): the msgids of requests numbered from `from`.
inline std::vector<int64_t> SXTestIds(int count, int from = 0) {
  std::vector<int64_t> ids(static_cast<size_t>(count));
  for (int i = 0; i < count; ++i) ids[static_cast<size_t>(i)] = from + i;
  return ids;
}
