#include "export/HttpPost.h"

#include <curl/curl.h>
#include <dlfcn.h>
#include <zlib.h>

#include <algorithm>
#include <cctype>
#include <ctime>
#include <type_traits>

#include "platform/Status.h"

namespace {

constexpr size_t kKeptResponseBytes = 4096;

// libcurl, loaded when the first request is made rather than linked: only the otlp-http backend
// posts anything, and libcurl's own libraries (TLS, Kerberos, ...) would add some 4 MiB to the
// resident set of every daemon, exporting or not.
struct CurlApi {
  decltype(&curl_global_init) globalInit = nullptr;
  decltype(&curl_easy_init) easyInit = nullptr;
  decltype(&curl_easy_cleanup) easyCleanup = nullptr;
  decltype(&curl_easy_reset) easyReset = nullptr;
  decltype(&curl_easy_setopt) easySetopt = nullptr;
  decltype(&curl_easy_perform) easyPerform = nullptr;
  decltype(&curl_easy_getinfo) easyGetinfo = nullptr;
  decltype(&curl_easy_strerror) easyStrerror = nullptr;
  decltype(&curl_slist_append) slistAppend = nullptr;
  decltype(&curl_slist_free_all) slistFreeAll = nullptr;
};

// The loaded library. Loads and initialises once (curl_global_init is not thread-safe); the
// library stays loaded for the life of the process.
SXResult<const CurlApi*> Curl() {
  static std::string failure;
  static const CurlApi* api = []() -> const CurlApi* {
    void* library = ::dlopen("libcurl.so.4", RTLD_NOW | RTLD_LOCAL);
    if (!library) {
      failure = std::string("cannot load libcurl: ") + ::dlerror();
      return nullptr;
    }
    static CurlApi loaded;
    bool complete = true;
    auto bind = [&](auto& function, const char* name) {
      function =
          reinterpret_cast<std::remove_reference_t<decltype(function)>>(::dlsym(library, name));
      if (!function) {
        failure = "libcurl has no ";
        failure += name;
        complete = false;
      }
    };
    bind(loaded.globalInit, "curl_global_init");
    bind(loaded.easyInit, "curl_easy_init");
    bind(loaded.easyCleanup, "curl_easy_cleanup");
    bind(loaded.easyReset, "curl_easy_reset");
    bind(loaded.easySetopt, "curl_easy_setopt");
    bind(loaded.easyPerform, "curl_easy_perform");
    bind(loaded.easyGetinfo, "curl_easy_getinfo");
    bind(loaded.easyStrerror, "curl_easy_strerror");
    bind(loaded.slistAppend, "curl_slist_append");
    bind(loaded.slistFreeAll, "curl_slist_free_all");
    if (!complete) return nullptr;
    loaded.globalInit(CURL_GLOBAL_DEFAULT);  // a failure shows up as a failing easyInit
    return &loaded;
  }();
  if (!api) return SXFailure(failure);
  return api;
}

size_t KeepResponse(char* data, size_t size, size_t count, void* user) {
  auto* body = static_cast<std::string*>(user);
  size_t bytes = size * count;
  if (body->size() < kKeptResponseBytes) {
    body->append(data, std::min(bytes, kKeptResponseBytes - body->size()));
  }
  return bytes;
}

// Keeps the headers of the last response: an interim one (1xx) starts the collection over.
size_t KeepHeader(char* data, size_t size, size_t count, void* user) {
  auto* headers = static_cast<std::map<std::string, std::string>*>(user);
  std::string_view line(data, size * count);
  if (line.starts_with("HTTP/")) headers->clear();
  size_t colon = line.find(':');
  if (colon != std::string_view::npos && colon > 0) {
    std::string name(line.substr(0, colon));
    std::transform(name.begin(), name.end(), name.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    std::string_view value = line.substr(colon + 1);
    size_t first = value.find_first_not_of(" \t");
    size_t last = value.find_last_not_of(" \t\r\n");
    (*headers)[name] = first > last || first == std::string_view::npos
                           ? std::string()
                           : std::string(value.substr(first, last - first + 1));
  }
  return size * count;
}

int AbortWhenCancelled(void* user, curl_off_t, curl_off_t, curl_off_t, curl_off_t) {
  return static_cast<std::atomic<bool>*>(user)->load() ? 1 : 0;
}

struct HeaderList {
  const CurlApi& curl;
  curl_slist* list = nullptr;
  ~HeaderList() { curl.slistFreeAll(list); }
  bool add(const std::string& line) {
    curl_slist* grown = curl.slistAppend(list, line.c_str());
    if (grown) list = grown;
    return grown != nullptr;
  }
};

}  // namespace

std::optional<std::chrono::milliseconds> SXRetryAfter(const std::string& value, SXDate now) {
  using std::chrono::milliseconds;
  if (!value.empty() && value.find_first_not_of("0123456789") == std::string::npos) {
    // More than a year is as good as forever; the caller caps it anyway.
    return std::chrono::seconds(value.size() > 8 ? 99999999 : std::stoll(value));
  }
  // The preferred format, then the two obsolete ones that recipients still have to read.
  for (const char* format :
       {"%a, %d %b %Y %H:%M:%S GMT", "%A, %d-%b-%y %H:%M:%S GMT", "%a %b %e %H:%M:%S %Y"}) {
    std::tm date{};
    const char* end = ::strptime(value.c_str(), format, &date);
    if (!end || *end != '\0') continue;
    auto when = std::chrono::system_clock::from_time_t(::timegm(&date));
    return std::max(milliseconds(0), std::chrono::duration_cast<milliseconds>(when - now));
  }
  return std::nullopt;
}

std::optional<std::string> SXGzip(std::string_view body) {
  z_stream stream{};
  // 15 window bits, +16 for a gzip header and trailer rather than a zlib one.
  if (deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY) !=
      Z_OK) {
    return std::nullopt;
  }
  std::string zipped(deflateBound(&stream, body.size()), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(zipped.data());
  stream.avail_out = static_cast<uInt>(zipped.size());
  int status = deflate(&stream, Z_FINISH);
  zipped.resize(stream.total_out);
  deflateEnd(&stream);
  if (status != Z_STREAM_END) return std::nullopt;
  return zipped;
}

struct SXCurlHttpPost::Handle {
  struct Cleanup {
    const CurlApi* api;
    void operator()(CURL* curl) const { api->easyCleanup(curl); }
  };
  explicit Handle(const CurlApi& api) : api(api), curl(nullptr, Cleanup{&api}) {}
  const CurlApi& api;
  std::unique_ptr<CURL, Cleanup> curl;
};

SXCurlHttpPost::SXCurlHttpPost() = default;

SXCurlHttpPost::~SXCurlHttpPost() = default;

SXHttpResult SXCurlHttpPost::post(const SXHttpRequest& request) {
  SXMutexLock lock(mutex_);
  SXHttpResult result;
  if (cancelled_) {
    result.error = "cancelled";
    return result;
  }
  if (!handle_) {
    SXResult<const CurlApi*> api = Curl();
    if (!api.ok()) {
      result.error = api.error();
      return result;
    }
    handle_ = std::make_unique<Handle>(**api);
  }
  const CurlApi& api = handle_->api;
  if (!handle_->curl) handle_->curl.reset(api.easyInit());
  CURL* curl = handle_->curl.get();
  if (!curl) {
    result.error = "cannot make an HTTP handle";
    return result;
  }
  api.easyReset(curl);  // keeps the open connection, forgets the last request's options

  HeaderList headers{api};
  // No "Expect: 100-continue" round trip before larger bodies.
  bool headersMade = headers.add("Expect:");
  for (const auto& [name, value] : request.headers) headersMade &= headers.add(name + ": " + value);
  if (!headersMade) {
    result.error = "cannot build the request headers";
    return result;
  }
  char errorText[CURL_ERROR_SIZE] = "";
  api.easySetopt(curl, CURLOPT_URL, request.url.c_str());
  api.easySetopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
  api.easySetopt(curl, CURLOPT_NOSIGNAL, 1L);
  api.easySetopt(curl, CURLOPT_POST, 1L);
  api.easySetopt(curl, CURLOPT_POSTFIELDS, request.body.data());
  api.easySetopt(curl, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.body.size()));
  api.easySetopt(curl, CURLOPT_HTTPHEADER, headers.list);
  api.easySetopt(curl, CURLOPT_TIMEOUT_MS, static_cast<long>(request.timeout.count()));
  api.easySetopt(curl, CURLOPT_WRITEFUNCTION, KeepResponse);
  api.easySetopt(curl, CURLOPT_WRITEDATA, &result.body);
  api.easySetopt(curl, CURLOPT_HEADERFUNCTION, KeepHeader);
  api.easySetopt(curl, CURLOPT_HEADERDATA, &result.headers);
  api.easySetopt(curl, CURLOPT_NOPROGRESS, 0L);
  api.easySetopt(curl, CURLOPT_XFERINFOFUNCTION, AbortWhenCancelled);
  api.easySetopt(curl, CURLOPT_XFERINFODATA, &cancelled_);
  api.easySetopt(curl, CURLOPT_ERRORBUFFER, errorText);

  CURLcode code = api.easyPerform(curl);
  if (code != CURLE_OK) {
    result.error = *errorText ? errorText : api.easyStrerror(code);
    result.timedOut = code == CURLE_OPERATION_TIMEDOUT;
    result.body.clear();
    result.headers.clear();
    handle_->curl.reset();  // a broken connection is not reused
  } else {
    long status = 0;
    api.easyGetinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    result.status = static_cast<int>(status);
  }
  // The handle outlives this call; it must not point at our locals.
  if (handle_->curl) {
    api.easySetopt(curl, CURLOPT_ERRORBUFFER, nullptr);
    api.easySetopt(curl, CURLOPT_HTTPHEADER, nullptr);
  }
  return result;
}
