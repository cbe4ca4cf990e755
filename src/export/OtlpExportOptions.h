// The options of the "otlp-http" backend: the "otlp-http" object of fernreporting.json, with
// the standard OpenTelemetry exporter environment variables filling in what the file leaves
// out. Pure functions but load(); callable from any thread.
//
// Precedence, per option: a key written in the file wins; otherwise the signal-specific
// variable (OTEL_EXPORTER_OTLP_LOGS_*), then the generic one (OTEL_EXPORTER_OTLP_*), then the
// default. Headers and resource attributes are merged per name with the same order.
//
//   file key              variables
//   endpoint              OTEL_EXPORTER_OTLP_LOGS_ENDPOINT (as is),
//                         OTEL_EXPORTER_OTLP_ENDPOINT (with "/v1/logs" appended)
//   headers               OTEL_EXPORTER_OTLP_LOGS_HEADERS, OTEL_EXPORTER_OTLP_HEADERS
//   timeoutMs             OTEL_EXPORTER_OTLP_LOGS_TIMEOUT, OTEL_EXPORTER_OTLP_TIMEOUT
//   compression           OTEL_EXPORTER_OTLP_LOGS_COMPRESSION, OTEL_EXPORTER_OTLP_COMPRESSION
//   encoding              OTEL_EXPORTER_OTLP_LOGS_PROTOCOL, OTEL_EXPORTER_OTLP_PROTOCOL
//                         (http/json, http/protobuf)
//   resourceAttributes    OTEL_RESOURCE_ATTRIBUTES, and OTEL_SERVICE_NAME for service.name
#pragma once

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "export/OtlpLogsBody.h"
#include "platform/Log.h"
#include "platform/Status.h"
#include "sxreporting/types.h"

// Environment variables by name.
using SXEnvironment = std::map<std::string, std::string>;

struct SXOtlpExportOptions {
  enum class Encoding { kJson, kProtobuf };

  std::string endpoint = "http://127.0.0.1:4318/v1/logs";
  std::map<std::string, std::string> headers;  // sent with every request
  size_t batchSize = 256;
  size_t maxBatchBytes = 4 << 20;
  std::chrono::milliseconds interval{1000};  // between passes once the backlog is drained
  std::chrono::milliseconds initialBackoff{1000};
  std::chrono::milliseconds maxBackoff{60000};
  std::chrono::milliseconds timeout{10000};  // for one POST
  Encoding encoding = Encoding::kJson;
  bool gzip = true;  // "compression": "gzip" or "none"
  SXOtlpResource resource;

  // The options of the "otlp-http" object of fernreporting.json alone: endpoint, headers,
  // batchSize, maxBatchBytes, intervalMs, initialBackoffMs, maxBackoffMs, timeoutMs,
  // compression, encoding, resourceAttributes; absent keys keep their defaults. Fails on a
  // key it does not know or a bad value.
  static SXResult<SXOtlpExportOptions> fromJson(const SXValue& section);

  // The options of `section` with `environment` filling in what it leaves out (see above).
  // Fails on a bad value, in the file or in a variable.
  static SXResult<SXOtlpExportOptions> fromSources(const SXValue& section,
                                                   const SXEnvironment& environment);

  // The options in the config file `configPath` and the process environment when `backends`
  // lists "otlp-http"; none when it does not, or after an error line on `log` when a value is
  // bad.
  static std::optional<SXOtlpExportOptions> load(const std::string& configPath,
                                                 const std::vector<std::string>& backends,
                                                 SXLogFacility& log);
};
