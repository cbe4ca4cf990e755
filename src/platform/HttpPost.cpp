#include "platform/HttpPost.h"

#include <curl/curl.h>

namespace {

constexpr size_t kKeptResponseBytes = 4096;

// curl_global_init is not thread-safe, so it runs once, before the first handle.
void InitCurlOnce() {
  static const CURLcode initialised = curl_global_init(CURL_GLOBAL_DEFAULT);
  (void)initialised;  // a failed init shows up as a failing curl_easy_init
}

size_t KeepResponse(char* data, size_t size, size_t count, void* user) {
  auto* body = static_cast<std::string*>(user);
  size_t bytes = size * count;
  if (body->size() < kKeptResponseBytes) {
    body->append(data, std::min(bytes, kKeptResponseBytes - body->size()));
  }
  return bytes;
}

int AbortWhenCancelled(void* user, curl_off_t, curl_off_t, curl_off_t, curl_off_t) {
  return static_cast<std::atomic<bool>*>(user)->load() ? 1 : 0;
}

struct HeaderList {
  curl_slist* list = nullptr;
  ~HeaderList() { curl_slist_free_all(list); }
  bool add(const std::string& line) {
    curl_slist* grown = curl_slist_append(list, line.c_str());
    if (grown) list = grown;
    return grown != nullptr;
  }
};

}  // namespace

struct SXCurlHttpPost::Handle {
  struct Cleanup {
    void operator()(CURL* curl) const { curl_easy_cleanup(curl); }
  };
  std::unique_ptr<CURL, Cleanup> curl;
};

SXCurlHttpPost::SXCurlHttpPost() { InitCurlOnce(); }

SXCurlHttpPost::~SXCurlHttpPost() = default;

SXHttpResult SXCurlHttpPost::post(const SXHttpRequest& request) {
  std::lock_guard lock(mutex_);
  SXHttpResult result;
  if (cancelled_) {
    result.error = "cancelled";
    return result;
  }
  if (!handle_) handle_ = std::make_unique<Handle>();
  if (!handle_->curl) handle_->curl.reset(curl_easy_init());
  CURL* curl = handle_->curl.get();
  if (!curl) {
    result.error = "cannot make an HTTP handle";
    return result;
  }
  curl_easy_reset(curl);  // keeps the open connection, forgets the last request's options

  HeaderList headers;
  // No "Expect: 100-continue" round trip before larger bodies.
  bool headersMade = headers.add("Expect:");
  for (const auto& [name, value] : request.headers) headersMade &= headers.add(name + ": " + value);
  if (!headersMade) {
    result.error = "cannot build the request headers";
    return result;
  }
  char errorText[CURL_ERROR_SIZE] = "";
  curl_easy_setopt(curl, CURLOPT_URL, request.url.c_str());
  curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(curl, CURLOPT_POST, 1L);
  curl_easy_setopt(curl, CURLOPT_POSTFIELDS, request.body.data());
  curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.body.size()));
  curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers.list);
  curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, static_cast<long>(request.timeout.count()));
  curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, KeepResponse);
  curl_easy_setopt(curl, CURLOPT_WRITEDATA, &result.body);
  curl_easy_setopt(curl, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(curl, CURLOPT_XFERINFOFUNCTION, AbortWhenCancelled);
  curl_easy_setopt(curl, CURLOPT_XFERINFODATA, &cancelled_);
  curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, errorText);

  CURLcode code = curl_easy_perform(curl);
  if (code != CURLE_OK) {
    result.error = *errorText ? errorText : curl_easy_strerror(code);
    result.body.clear();
    handle_->curl.reset();  // a broken connection is not reused
  } else {
    long status = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    result.status = static_cast<int>(status);
  }
  // The handle outlives this call; it must not point at our locals.
  if (handle_->curl) {
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, nullptr);
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, nullptr);
  }
  return result;
}
