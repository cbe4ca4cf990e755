// The "otlp-http" server-reporting backend: a thread of its own that uploads the messages of
// the spool (`<state-dir>/fernreporting.db`, see SqliteFernReporting.h), session messages and
// standalone messages alike, as OpenTelemetry log records to a collector's OTLP/HTTP endpoint
// (body: OtlpLogsBody.h, in JSON or protobuf (OtlpProtobuf.h), gzip-compressed or not).
//
// It reads the spool's `messages` table in row-id order beyond a durable cursor kept in the
// same database, in the table otlp_export(id = 1, last_message_id), and POSTs one request per
// batch (at most `batchSize` rows and about `maxBatchBytes` of payload). The cursor moves, in
// one statement, only after the collector answered 2xx: every message goes in exactly one
// successful POST while the process runs. Delivery is at least once: a POST the collector took
// but did not answer in time is posted again, and so is a batch posted but not yet
// acknowledged when the process dies; each record carries its row id (sxr.message.id) so that
// a collector can drop the repeats. Their number is bounded: after a time-out the next batch
// is half as large (down to one message) and may take twice as long (up to kTimeoutGrowth
// times `timeout`), until the backlog is drained; batches grow back by doubling after each
// 2xx. A collector that answers within kTimeoutGrowth times `timeout` thus gets each message
// at most 1 + log2(kTimeoutGrowth) = 4 times while the process runs.
//
// Answers:
//   2xx                     the cursor moves past the batch; a partial success is logged.
//   408, 429, 5xx, 401, 403, 404, other 1xx/3xx, no response
//                           retried after a back-off that doubles from `initialBackoff` up to
//                           `maxBackoff`, with jitter (half fixed, half random); one error line
//                           per failure streak and one line when exports go through again.
//                           A 429 or 503 with Retry-After waits at least that long (at most
//                           kMaxRetryAfter), never less than the back-off.
//                           Unauthorised or missing endpoints are configuration faults that an
//                           operator fixes; the messages wait in the spool meanwhile.
//   413                     the batch is halved and retried at once, and batches keep that
//                           size until the backlog is drained; a single message that is still
//                           too large is dropped as below.
//   other 4xx               the collector rejects this body and would reject it again: the
//                           batch is dropped with an error line naming its row ids and the
//                           cursor moves on, so that one bad message cannot hold up the rest.
//
// start() and stop() are called by the owner (main); backlog() from any thread. Nothing throws.
// A spool that cannot be opened or read counts as a failed attempt and is retried.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "common/SXThreadSafety.h"
#include "export/HttpPost.h"
#include "export/OtlpExportOptions.h"
#include "export/OtlpSpoolReader.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/Random.h"

class SXOtlpHttpExporter {
 public:
  enum class Outcome {
    kIdle,      // nothing beyond the cursor
    kExported,  // a batch went and the cursor moved
    kDropped,   // the collector rejected a batch for good; the cursor moved past it
    kShrunk,    // the batch was too large; a smaller one is tried next
    kFailed,    // nothing moved; the next attempt waits for the back-off
  };
  struct Pass {
    Outcome outcome = Outcome::kIdle;
    size_t rows = 0;   // rows posted
    size_t limit = 0;  // the most rows the pass could take
  };

  // A time-out raises the time allowed for a request by doubling up to this factor.
  static constexpr int kTimeoutGrowth = 8;
  // The longest wait a Retry-After header can impose.
  static constexpr std::chrono::milliseconds kMaxRetryAfter{5 * 60 * 1000};

  SXOtlpHttpExporter(std::string dbPath, SXOtlpExportOptions options,
                     std::shared_ptr<SXHttpPost> http, std::shared_ptr<SXClock> clock,
                     std::shared_ptr<SXRandom> random, std::shared_ptr<SXLogFacility> log);
  ~SXOtlpHttpExporter();  // stops
  SXOtlpHttpExporter(const SXOtlpHttpExporter&) = delete;
  SXOtlpHttpExporter& operator=(const SXOtlpHttpExporter&) = delete;

  // Starts the thread "sxr-otlp", which runs passes until stop(). Only the first call starts.
  void start();
  // Cancels a POST in progress (and every later one) and joins the thread. The cursor stays
  // where it is. With `cancelPost` false, a POST in progress is answered first (and the cursor
  // moves); its timeout bounds the wait.
  void stop(bool cancelPost = true);

  // Messages beyond the cursor. On failure returns the last count it could read (0 at first).
  uint64_t backlog() const;

  // One pass: reads one batch beyond the cursor, posts it and judges the answer. The thread
  // runs these; tests call it directly, without start(). REQUIRES: one caller at a time.
  Pass exportOnce();
  // How long to wait after `pass` before the next one: no wait while a full batch suggests
  // more is waiting, the back-off after a failure, the interval otherwise.
  std::chrono::milliseconds delayAfter(const Pass& pass);

 private:
  SXResult<SXHttpRequest> request(const std::vector<SXValue>& rows) const;
  Pass post(const std::vector<SXValue>& rows);
  // Moves the cursor past `last` after an answer that settles the batch.
  Pass moved(int64_t last, Outcome outcome, size_t rows);
  Pass dropped(int64_t first, int64_t last, size_t rows, const std::string& why);
  Pass failed(const std::string& why);
  void succeeded();
  void slowedDown(size_t posted);
  std::optional<std::chrono::milliseconds> requestedWait(const SXHttpResult& result) const;
  void run();

  const SXOtlpExportOptions options_;
  const std::shared_ptr<SXHttpPost> http_;
  const std::shared_ptr<SXClock> clock_;
  const std::shared_ptr<SXRandom> random_;
  const std::shared_ptr<SXLogFacility> log_;
  SXOtlpSpoolReader spool_;  // has its own lock: backlog() reads it from other threads

  // Used by the exporting thread only (or the one caller of exportOnce).
  size_t sizeLimit_;  // batchSize, halved after a 413, restored once the backlog is drained
  size_t paceLimit_;  // batchSize, halved after a time-out, doubled after each 2xx
  std::chrono::milliseconds timeout_;  // doubled after a time-out, reset once drained
  std::optional<std::chrono::milliseconds> retryAfter_;  // asked for by the last answer
  unsigned failures_ = 0;                                // failed attempts in the current streak

  SXMutex mutex_;
  std::condition_variable wake_;  // with mutex_: stop() wakes the thread from its wait
  bool stopping_ SX_GUARDED_BY(mutex_) = false;
  bool started_ = false;  // start() and stop() belong to the owner's thread
  std::thread thread_;    // started and joined under no lock, by the owner only
};
