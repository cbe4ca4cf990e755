// HTTP POST: sends one request body to a URL and returns the response status and headers, for
// uploaders such as the OTLP exporter.
//
// post() may be called from any thread; an implementation serialises its own calls, so callers
// normally post from one thread of their own. cancel() may be called from any thread, and makes
// the post in progress and every later one fail at once (for shutdown).
//
// On failure (no response: bad URL, refused connection, time-out, cancelled) post() returns a
// result without a status and with an error text saying why. A response of any status, 4xx and
// 5xx included, is not a failure of post(): the status is there for the caller to judge.
#pragma once

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "common/SXThreadSafety.h"
#include "platform/Clock.h"

struct SXHttpRequest {
  std::string url;
  std::map<std::string, std::string> headers;  // e.g. {"Content-Type", "application/json"}
  std::string body;
  std::chrono::milliseconds timeout{10000};  // for the whole exchange, connecting included
};

struct SXHttpResult {
  std::optional<int> status;                   // none when no response came
  std::map<std::string, std::string> headers;  // of the response; names in lower case
  std::string body;                            // the start of the response body (the first 4 KiB)
  std::string error;                           // why no response came; empty when one did
  bool timedOut = false;                       // no response within the request's timeout
};

// The wait a Retry-After header's `value` asks for, in delta-seconds or as an HTTP-date (taken
// relative to `now`; a date in the past is no wait); none when `value` is neither.
std::optional<std::chrono::milliseconds> SXRetryAfter(const std::string& value, SXDate now);

// `body` gzip-compressed (for "Content-Encoding: gzip"); none when zlib fails (out of memory).
std::optional<std::string> SXGzip(std::string_view body);

class SXHttpPost {
 public:
  virtual ~SXHttpPost() = default;
  virtual SXHttpResult post(const SXHttpRequest& request) = 0;
  virtual void cancel() = 0;
};

// Production HTTP over libcurl (http and https only; redirects are not followed). One handle
// is kept between posts so that the connection to the collector stays open.
class SXCurlHttpPost final : public SXHttpPost {
 public:
  SXCurlHttpPost();
  ~SXCurlHttpPost() override;
  SXCurlHttpPost(const SXCurlHttpPost&) = delete;
  SXCurlHttpPost& operator=(const SXCurlHttpPost&) = delete;

  SXHttpResult post(const SXHttpRequest& request) override;
  void cancel() override { cancelled_ = true; }

 private:
  struct Handle;
  SXMutex mutex_;
  std::unique_ptr<Handle> handle_ SX_GUARDED_BY(mutex_);
  std::atomic<bool> cancelled_{false};
};
