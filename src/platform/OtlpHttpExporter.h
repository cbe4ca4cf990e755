// The "otlp-http" server-reporting backend: a thread of its own that uploads the messages of
// the spool (`<state-dir>/fernreporting.db`, see SqliteFernReporting.h), session messages and
// standalone messages alike, as OpenTelemetry log records to a collector's OTLP/HTTP JSON
// endpoint (body: OtlpLogsBody.h).
//
// It reads the spool's `messages` table in row-id order beyond a durable cursor kept in the
// same database, in the table otlp_export(id = 1, last_message_id), and POSTs one request per
// batch (at most `batchSize` rows and about `maxBatchBytes` of payload). The cursor moves, in
// one statement, only after the collector answered 2xx: every message goes in exactly one
// successful POST while the process runs. A batch posted but not yet acknowledged when the
// process dies is posted again after the restart (at least once across crashes); each record
// carries its row id (sxr.message.id) so that a collector can drop the repeat.
//
// Answers:
//   2xx                     the cursor moves past the batch; a partial success is logged.
//   408, 429, 5xx, 401, 403, 404, other 1xx/3xx, no response
//                           retried after a back-off that doubles from `initialBackoff` up to
//                           `maxBackoff`, with jitter (half fixed, half random); one error line
//                           per failure streak and one line when exports go through again.
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

#include "platform/Clock.h"
#include "platform/HttpPost.h"
#include "platform/Log.h"
#include "platform/OtlpLogsBody.h"
#include "platform/OtlpSpoolReader.h"
#include "platform/Random.h"

struct SXOtlpExportOptions {
  std::string endpoint = "http://127.0.0.1:4318/v1/logs";
  std::map<std::string, std::string> headers;  // sent with every request
  size_t batchSize = 256;
  size_t maxBatchBytes = 4 << 20;
  std::chrono::milliseconds interval{1000};  // between passes once the backlog is drained
  std::chrono::milliseconds initialBackoff{1000};
  std::chrono::milliseconds maxBackoff{60000};
  std::chrono::milliseconds timeout{10000};  // for one POST
  SXOtlpResource resource;

  // The options of the "otlp-http" object of fernreporting.json: endpoint, headers, batchSize,
  // maxBatchBytes, intervalMs, initialBackoffMs, maxBackoffMs, timeoutMs; absent keys keep
  // their defaults. On a key it does not know or a bad value returns none and sets `error`.
  static std::optional<SXOtlpExportOptions> fromJson(const SXValue& section, std::string& error);

  // The options in the config file `configPath` when `backends` lists "otlp-http"; none when
  // it does not, or after an error line on `log` when the file's "otlp-http" object is bad.
  static std::optional<SXOtlpExportOptions> load(const std::string& configPath,
                                                 const std::vector<std::string>& backends,
                                                 SXLogFacility& log);
};

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
    size_t rows = 0;  // rows posted
  };

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
  Pass post(const std::vector<SXValue>& rows);
  Pass failed(const std::string& why);
  void succeeded();
  void run();

  const SXOtlpExportOptions options_;
  const std::shared_ptr<SXHttpPost> http_;
  const std::shared_ptr<SXClock> clock_;
  const std::shared_ptr<SXRandom> random_;
  const std::shared_ptr<SXLogFacility> log_;
  SXOtlpSpoolReader spool_;  // has its own lock: backlog() reads it from other threads

  // Used by the exporting thread only (or the one caller of exportOnce).
  size_t batchLimit_;      // batchSize, halved after a 413, restored after a 2xx
  unsigned failures_ = 0;  // failed attempts in the current streak

  std::mutex mutex_;
  std::condition_variable wake_;  // with mutex_: stop() wakes the thread from its wait
  bool stopping_ = false;         // guarded by mutex_
  bool started_ = false;          // start() and stop() belong to the owner's thread
  std::thread thread_;            // started and joined under no lock, by the owner only
};
