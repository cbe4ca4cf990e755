#include "export/OtlpHttpExporter.h"

#include <pthread.h>

#include <algorithm>

#include "common/SXValueText.h"
#include "export/OtlpProtobuf.h"
#include "platform/DiscardLog.h"

namespace {

using std::chrono::milliseconds;

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
      sizeLimit_(options_.batchSize),
      paceLimit_(options_.batchSize),
      timeout_(options_.timeout) {}

SXOtlpHttpExporter::~SXOtlpHttpExporter() { stop(); }

uint64_t SXOtlpHttpExporter::backlog() const { return spool_.backlog(); }

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::exportOnce() {
  retryAfter_.reset();
  std::vector<SXValue> rows;
  size_t limit = std::min(sizeLimit_, paceLimit_);
  if (SXStatus read = spool_.read(limit, options_.maxBatchBytes, rows); !read.ok()) {
    return failed("cannot read the spool: " + read.error());
  }
  if (rows.empty()) {
    // The backlog that met a size limit or a slow collector is gone.
    sizeLimit_ = options_.batchSize;
    timeout_ = options_.timeout;
    return {Outcome::kIdle, 0, limit};
  }
  Pass pass = post(rows);
  pass.limit = limit;
  return pass;
}

SXResult<SXHttpRequest> SXOtlpHttpExporter::request(const std::vector<SXValue>& rows) const {
  SXHttpRequest request{options_.endpoint, options_.headers, "", timeout_};
  request.body = SXOtlpLogsRequest(rows, options_.resource, clock_->now())
                     .dump(-1, ' ', false, SXValue::error_handler_t::replace);
  request.headers["Content-Type"] = "application/json";
  if (options_.encoding == SXOtlpExportOptions::Encoding::kProtobuf) {
    auto bytes = SXOtlpRequestProtobuf(request.body);
    if (!bytes.ok()) return bytes.status();
    request.body = std::move(*bytes);
    request.headers["Content-Type"] = "application/x-protobuf";
  }
  if (options_.gzip) {
    // Sent uncompressed in the unlikely case that zlib has no memory.
    if (auto zipped = SXGzip(request.body)) {
      request.body = std::move(*zipped);
      request.headers["Content-Encoding"] = "gzip";
    }
  }
  return request;
}

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::post(const std::vector<SXValue>& rows) {
  int64_t first = RowId(rows.front()), last = RowId(rows.back());
  auto request = this->request(rows);
  if (!request.ok()) {
    return dropped(first, last, rows.size(), "cannot encode them: " + request.error());
  }
  SXHttpResult result = http_->post(*request);
  if (!result.status) {
    if (result.timedOut) slowedDown(rows.size());
    return failed(result.error);
  }
  int status = *result.status;
  bool accepted = status >= 200 && status < 300;
  if (!accepted && IsRetried(status)) {
    if (status == 429 || status == 503) retryAfter_ = requestedWait(result);
    return failed(SXFormat("the collector answered %i %@", status, OneLine(result.body)));
  }
  if (!accepted && status == 413 && rows.size() > 1) {
    sizeLimit_ = rows.size() / 2;
    SXLOG(*log_, nullptr, SXLogLevel::kInfo,
          "the collector found %zu messages too large; trying %zu at a time", rows.size(),
          sizeLimit_);
    return {Outcome::kShrunk, rows.size()};
  }
  if (!accepted) {
    return dropped(
        first, last, rows.size(),
        SXFormat("the collector rejected them with %i %@", status, OneLine(result.body)));
  }
  bool protobuf = result.headers["content-type"] == "application/x-protobuf";
  LogPartialSuccess(*log_, protobuf ? SXOtlpResponseJson(result.body) : result.body, first, last);
  paceLimit_ = std::min(options_.batchSize, paceLimit_ * 2);
  return moved(last, Outcome::kExported, rows.size());
}

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::dropped(int64_t first, int64_t last, size_t rows,
                                                     const std::string& why) {
  SXLOG(*log_, nullptr, SXLogLevel::kError, "dropping messages %lli to %lli: %@", first, last, why);
  return moved(last, Outcome::kDropped, rows);
}

SXOtlpHttpExporter::Pass SXOtlpHttpExporter::moved(int64_t last, Outcome outcome, size_t rows) {
  if (SXStatus written = spool_.advance(last); !written.ok()) {
    // The cursor moved in memory, so nothing goes twice while this process runs.
    SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot store the export cursor: %@",
          written.error());
  }
  succeeded();
  return {outcome, rows};
}

void SXOtlpHttpExporter::slowedDown(size_t posted) {
  // The collector may have taken the batch it did not answer in time: fewer messages and more
  // patience next time, so that a slow collector gets each message only a few times.
  paceLimit_ = std::max<size_t>(1, posted / 2);
  timeout_ = std::min(timeout_ * 2, options_.timeout * kTimeoutGrowth);
}

std::optional<milliseconds> SXOtlpHttpExporter::requestedWait(const SXHttpResult& result) const {
  auto header = result.headers.find("retry-after");
  if (header == result.headers.end()) return std::nullopt;
  auto wait = SXRetryAfter(header->second, clock_->now());
  if (!wait) return std::nullopt;
  return std::min(*wait, kMaxRetryAfter);
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
      return pass.rows >= pass.limit ? milliseconds(0) : options_.interval;
    case Outcome::kFailed: {
      // Doubling from the initial back-off, capped; half of it is random so that many daemons
      // that lost the same collector do not come back at the same moment. A collector that
      // asks for a longer wait gets it.
      int64_t base = options_.initialBackoff.count();
      for (unsigned i = 1; i < failures_ && base < options_.maxBackoff.count(); ++i) base *= 2;
      base = std::min(base, options_.maxBackoff.count());
      uint32_t half = static_cast<uint32_t>(base / 2);
      milliseconds backoff(base - half + random_->uniform(half + 1));
      return std::max(backoff, retryAfter_.value_or(milliseconds(0)));
    }
    case Outcome::kIdle:
      break;
  }
  return options_.interval;
}

void SXOtlpHttpExporter::start() {
  if (started_) return;
  started_ = true;
  SXLOG(*log_, nullptr, SXLogLevel::kDefault, "exporting spooled messages to %@ (OTLP/HTTP %@%@)",
        options_.endpoint,
        options_.encoding == SXOtlpExportOptions::Encoding::kProtobuf ? "protobuf" : "JSON",
        options_.gzip ? ", gzip" : "");
  thread_ = std::thread([this] { run(); });
}

void SXOtlpHttpExporter::stop(bool cancelPost) {
  if (!thread_.joinable()) return;
  {
    SXMutexLock lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  if (cancelPost) http_->cancel();
  thread_.join();
}

void SXOtlpHttpExporter::run() {
  pthread_setname_np(pthread_self(), "sxr-otlp");
  SXMutexLock lock(mutex_);
  while (!stopping_) {
    lock.unlock();
    milliseconds delay = options_.interval;
    try {
      delay = delayAfter(exportOnce());
    } catch (const std::exception& error) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "export pass failed: %@", error.what());
    }
    lock.lock();
    lock.waitFor(wake_, delay, [this]() SX_REQUIRES(mutex_) { return stopping_; });
  }
}
