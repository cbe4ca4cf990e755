// A small OTLP/HTTP logs collector for tests: an HTTP/1.1 server (bodies by Content-Length,
// keep-alive) on 127.0.0.1 at an ephemeral port, run by a thread of its own. It records every
// request, gzip bodies decoded, and answers 200
// with "{}", unless told to answer the next requests with another status (and Retry-After), to
// drop their connections without an answer, or to answer late. JSON and protobuf bodies are
// both read as OTLP logs requests.
//
// All methods may be called from any thread.
#pragma once

#include <asio.hpp>
#include <chrono>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "sxreporting/types.h"

class OtlpReceiver {
 public:
  struct Request {
    std::map<std::string, std::string> headers;  // names in lower case
    std::string body;                            // as sent, but decompressed
    int status = 0;  // the status it was answered with; 0 when its connection was dropped
  };

  OtlpReceiver();
  ~OtlpReceiver();
  OtlpReceiver(const OtlpReceiver&) = delete;
  OtlpReceiver& operator=(const OtlpReceiver&) = delete;

  // "http://127.0.0.1:<port>/v1/logs"
  std::string endpoint() const;

  // The next `count` requests are answered with `status` instead of 200 (and a Retry-After
  // header when `retryAfter` is not empty), or with their connection closed (dropNext).
  void failNext(size_t count, int status, std::string retryAfter = "");
  void dropNext(size_t count) { failNext(count, 0); }
  // Every answer from now on comes `delay` after its request.
  void answerAfter(std::chrono::milliseconds delay);

  std::vector<Request> requests() const;
  // The log records of the requests answered 200, in the order they came (whether or not the
  // answer reached the client in time), each with its attributes also under "attrs" as
  // key: value ({"sxr.message.id": "5"}: 64-bit integers are strings in OTLP JSON).
  std::vector<SXValue> acceptedRecords() const;
  // The body of `request` as OTLP JSON, protobuf bodies converted.
  static SXValue json(const Request& request);

 private:
  class Connection;
  friend class Connection;

  void accept();
  struct Answer {
    int status = 200;  // 0: drop the connection
    std::string retryAfter;
    std::chrono::milliseconds delay{0};
  };
  // How to answer `request`, recorded with it.
  Answer judge(Request request);

  asio::io_context io_;
  asio::ip::tcp::acceptor acceptor_{io_, {asio::ip::make_address("127.0.0.1"), 0}};
  mutable SXMutex mutex_;
  std::vector<Request> requests_ SX_GUARDED_BY(mutex_);
  size_t faultsLeft_ SX_GUARDED_BY(mutex_) = 0;
  Answer fault_ SX_GUARDED_BY(mutex_);
  std::chrono::milliseconds delay_ SX_GUARDED_BY(mutex_){0};
  std::thread thread_;
};
