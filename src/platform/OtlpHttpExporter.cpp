#include "platform/OtlpHttpExporter.h"

#include <pthread.h>

#include <algorithm>
#include <fstream>

#include "common/SXValueText.h"
#include "platform/DiscardLog.h"

namespace {

using std::chrono::milliseconds;

constexpr const char* kBackendName = "otlp-http";

// A whole number of `key` in [low, high], when present.
std::optional<std::string> ReadCount(const SXValue& section, const char* key, int64_t low,
                                     int64_t high, int64_t& out) {
  auto it = section.find(key);
  if (it == section.end()) return std::nullopt;
  if (!it->is_number_integer() || it->get<int64_t>() < low || it->get<int64_t>() > high) {
    return SXFormat("\"%@\" must be a whole number from %lli to %lli", key, low, high);
  }
  out = it->get<int64_t>();
  return std::nullopt;
}

std::optional<std::string> ReadMilliseconds(const SXValue& section, const char* key,
                                            milliseconds& out) {
  int64_t count = out.count();
  constexpr int64_t kDay = 24 * 3600 * 1000;
  if (auto bad = ReadCount(section, key, 1, kDay, count)) return bad;
  out = milliseconds(count);
  return std::nullopt;
}

std::optional<std::string> ReadEndpoint(const SXValue& section, std::string& endpoint) {
  auto it = section.find("endpoint");
  if (it == section.end()) return std::nullopt;
  if (!it->is_string() || !(it->get<std::string>().starts_with("http://") ||
                            it->get<std::string>().starts_with("https://"))) {
    return std::string("\"endpoint\" must be an http:// or https:// URL");
  }
  endpoint = it->get<std::string>();
  return std::nullopt;
}

std::optional<std::string> ReadHeaders(const SXValue& section,
                                       std::map<std::string, std::string>& headers) {
  auto it = section.find("headers");
  if (it == section.end()) return std::nullopt;
  if (!it->is_object()) return std::string("\"headers\" must be an object of strings");
  for (const auto& [name, value] : it->items()) {
    bool clean = name.find_first_of(":\r\n") == std::string::npos && !name.empty();
    if (!clean || !value.is_string() ||
        value.get_ref<const std::string&>().find_first_of("\r\n") != std::string::npos) {
      return SXFormat("header \"%@\" must be a name with a one-line string value", name);
    }
    headers[name] = value.get<std::string>();
  }
  return std::nullopt;
}

bool IsRetried(int status) {
  if (status >= 500 || status < 400) return true;  // 1xx and 3xx are not answers either
  return status == 401 || status == 403 || status == 404 || status == 408 || status == 429;
}

// A response body fit for one log line.
std::string OneLine(std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](char c) { return c == '\n' || c == '\r'; }, ' ');
  return text;
}

int64_t RowId(const SXValue& row) {
  auto it = row.find("id");
  return it != row.end() && it->is_number_integer() ? it->get<int64_t>() : 0;
}

// Logs a partial success: records the collector refused although it took the request.
void LogPartialSuccess(SXLogFacility& log, const std::string& responseBody, int64_t first,
                       int64_t last) {
  SXValue response = SXValue::parse(responseBody, nullptr, false);
  if (!response.is_object() || !response.contains("partialSuccess")) return;
  const SXValue& partial = response["partialSuccess"];
  if (!partial.is_object() || !partial.contains("rejectedLogRecords")) return;
  std::string rejected = SXValueText(partial["rejectedLogRecords"]);
  if (rejected == "0") return;
  SXLOG(log, nullptr, SXLogLevel::kError, "the collector rejected %@ of messages %lli to %lli: %@",
        rejected, first, last,
        partial.contains("errorMessage") ? SXValueText(partial["errorMessage"]) : "");
}

}  // namespace

std::optional<SXOtlpExportOptions> SXOtlpExportOptions::fromJson(const SXValue& section,
                                                                 std::string& error) {
  static const char* const kKnown[] = {"endpoint",      "headers",    "batchSize",
                                       "maxBatchBytes", "intervalMs", "initialBackoffMs",
                                       "maxBackoffMs",  "timeoutMs"};
  if (!section.is_object()) {
    error = "must be an object";
    return std::nullopt;
  }
  for (const auto& [key, value] : section.items()) {
    if (std::find(std::begin(kKnown), std::end(kKnown), key) == std::end(kKnown)) {
      error = SXFormat("unknown key \"%@\"", key);
      return std::nullopt;
    }
  }
  SXOtlpExportOptions options;
  int64_t batchSize = int64_t(options.batchSize), maxBytes = int64_t(options.maxBatchBytes);
  std::optional<std::string> bad = ReadEndpoint(section, options.endpoint);
  if (!bad) bad = ReadHeaders(section, options.headers);
  if (!bad) bad = ReadCount(section, "batchSize", 1, 100000, batchSize);
  if (!bad) bad = ReadCount(section, "maxBatchBytes", 1, int64_t(1) << 30, maxBytes);
  if (!bad) bad = ReadMilliseconds(section, "intervalMs", options.interval);
  if (!bad) bad = ReadMilliseconds(section, "initialBackoffMs", options.initialBackoff);
  if (!bad) bad = ReadMilliseconds(section, "maxBackoffMs", options.maxBackoff);
  if (!bad) bad = ReadMilliseconds(section, "timeoutMs", options.timeout);
  if (!bad && options.maxBackoff < options.initialBackoff) {
    bad = "\"maxBackoffMs\" must not be below \"initialBackoffMs\"";
  }
  if (bad) {
    error = *bad;
    return std::nullopt;
  }
  options.batchSize = size_t(batchSize);
  options.maxBatchBytes = size_t(maxBytes);
  return options;
}

std::optional<SXOtlpExportOptions> SXOtlpExportOptions::load(
    const std::string& configPath, const std::vector<std::string>& backends, SXLogFacility& log) {
  if (std::find(backends.begin(), backends.end(), kBackendName) == backends.end()) {
    return std::nullopt;
  }
  std::ifstream in(configPath);
  SXValue config = SXValue::parse(in, nullptr, false);
  SXValue section = SXValue::object();  // no "otlp-http" object: every default
  if (config.is_object() && config.contains(kBackendName)) section = config[kBackendName];
  std::string error;
  auto options = fromJson(section, error);
  if (!options) {
    SXLOG(log, nullptr, SXLogLevel::kError,
          "%@: \"otlp-http\": %@; not exporting (messages stay in the spool)", configPath, error);
  }
  return options;
}

SXOtlpHttpExporter::SXOtlpHttpExporter(std::string dbPath, SXOtlpExportOptions options,
                                       std::shared_ptr<SXHttpPost> http,
                                       std::shared_ptr<SXClock> clock,
                                       std::shared_ptr<SXRandom> random,
                                       std::shared_ptr<SXLogFacility> log)
    : options_(std::move(options)),
      http_(std::move(http)),
      clock_(std::move(clock)),
      random_(std::move(random)),
      log_(SXLogOrDiscard(std::move(log))),
      spool_(std::move(dbPath)),
      batchLimit_(options_.batchSize) {}

SXOtlpHttpExporter::~SXOtlpHttpExporter() { stop(); }

uint64_t SXOtlpHttpExporter::backlog() const { return spool_.backlog(); }

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::exportOnce() {
  std::vector<SXValue> rows;
  if (auto failed = spool_.read(batchLimit_, options_.maxBatchBytes, rows)) {
    return this->failed("cannot read the spool: " + *failed);
  }
  if (rows.empty()) {
    batchLimit_ = options_.batchSize;  // the backlog that met a size limit is gone
    return {Outcome::kIdle, 0};
  }
  return post(rows);
}

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::post(const std::vector<SXValue>& rows) {
  int64_t first = RowId(rows.front()), last = RowId(rows.back());
  SXHttpRequest request{options_.endpoint, options_.headers, "", options_.timeout};
  request.headers["Content-Type"] = "application/json";
  request.body = SXOtlpLogsRequest(rows, options_.resource, clock_->now())
                     .dump(-1, ' ', false, SXValue::error_handler_t::replace);
  SXHttpResult result = http_->post(request);
  if (!result.status) return failed(result.error);
  int status = *result.status;
  if (status >= 200 && status < 300) {
    LogPartialSuccess(*log_, result.body, first, last);
  } else if (IsRetried(status)) {
    return failed(SXFormat("the collector answered %i %@", status, OneLine(result.body)));
  } else if (status == 413 && rows.size() > 1) {
    batchLimit_ = rows.size() / 2;
    SXLOG(*log_, nullptr, SXLogLevel::kInfo,
          "the collector found %zu messages too large; trying %zu at a time", rows.size(),
          batchLimit_);
    return {Outcome::kShrunk, rows.size()};
  } else {
    SXLOG(*log_, nullptr, SXLogLevel::kError,
          "dropping messages %lli to %lli: the collector rejected them with %i %@", first, last,
          status, OneLine(result.body));
  }
  Outcome outcome = status < 300 ? Outcome::kExported : Outcome::kDropped;
  if (auto failedWrite = spool_.advance(last)) {
    // The cursor moved in memory, so nothing goes twice while this process runs.
    SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot store the export cursor: %@", *failedWrite);
  }
  succeeded();
  return {outcome, rows.size()};
}

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::failed(const std::string& why) {
  if (failures_++ == 0) {
    SXLOG(*log_, nullptr, SXLogLevel::kError,
          "cannot export to %@: %@; retrying with back-off, messages stay in the spool",
          options_.endpoint, why);
  } else {
    SXLOG(*log_, nullptr, SXLogLevel::kDebug, "attempt %u to export to %@ failed: %@", failures_,
          options_.endpoint, why);
  }
  return {Outcome::kFailed, 0};
}

void SXOtlpHttpExporter::succeeded() {
  if (failures_ == 0) return;
  SXLOG(*log_, nullptr, SXLogLevel::kDefault, "exporting to %@ again after %u failed attempts",
        options_.endpoint, failures_);
  failures_ = 0;
}

milliseconds SXOtlpHttpExporter::delayAfter(const Pass& pass) {
  switch (pass.outcome) {
    case Outcome::kShrunk:
      return milliseconds(0);
    case Outcome::kExported:
    case Outcome::kDropped:
      return pass.rows >= batchLimit_ ? milliseconds(0) : options_.interval;
    case Outcome::kFailed: {
      // Doubling from the initial back-off, capped; half of it is random so that many daemons
      // that lost the same collector do not come back at the same moment.
      int64_t base = options_.initialBackoff.count();
      for (unsigned i = 1; i < failures_ && base < options_.maxBackoff.count(); ++i) base *= 2;
      base = std::min(base, options_.maxBackoff.count());
      uint32_t half = static_cast<uint32_t>(base / 2);
      return milliseconds(base - half + random_->uniform(half + 1));
    }
    case Outcome::kIdle:
      break;
  }
  return options_.interval;
}

void SXOtlpHttpExporter::start() {
  if (started_) return;
  started_ = true;
  SXLOG(*log_, nullptr, SXLogLevel::kDefault, "exporting spooled messages to %@ (OTLP/HTTP JSON)",
        options_.endpoint);
  thread_ = std::thread([this] { run(); });
}

void SXOtlpHttpExporter::stop(bool cancelPost) {
  if (!thread_.joinable()) return;
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  if (cancelPost) http_->cancel();
  thread_.join();
}

void SXOtlpHttpExporter::run() {
  pthread_setname_np(pthread_self(), "sxr-otlp");
  std::unique_lock lock(mutex_);
  while (!stopping_) {
    lock.unlock();
    milliseconds delay = options_.interval;
    try {
      delay = delayAfter(exportOnce());
    } catch (const std::exception& error) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "export pass failed: %@", error.what());
    }
    lock.lock();
    wake_.wait_for(lock, delay, [this] { return stopping_; });
  }
}
