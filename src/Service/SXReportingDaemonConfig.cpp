#include "SXReportingDaemonConfig.h"

#include <fstream>
#include <sstream>

#include "platform/DiscardLog.h"

namespace {

using Applies = SXLimitApplies;
using L = SXReportingLimits;

// Which limits a reload can change follows from where each is read: per request, when a
// connection opens, or only by the listener built at start.
constexpr SXReportingLimitOption kLimitOptions[] = {
    {"max-sessions-per-client", "SXREPORTING_MAX_SESSIONS_PER_CLIENT", &L::maxSessionsPerClient,
     Applies::kNextRequest, "live sessions of one client; a create beyond it makes\nnothing"},
    {"max-sessions", "SXREPORTING_MAX_SESSIONS", &L::maxSessions, Applies::kNextRequest,
     "live sessions of all clients"},
    {"max-aggregate-entries", "SXREPORTING_MAX_AGGREGATE_ENTRIES", &L::maxAggregateEntries,
     Applies::kNextRequest,
     "entries a session gathers for its summary; later messages\nare sent but left out of it"},
    {"max-aggregate-bytes", "SXREPORTING_MAX_AGGREGATE_BYTES", &L::maxAggregateBytes,
     Applies::kNextRequest, "the same in bytes (texts and 256 an entry), per session"},
    {"max-aggregate-bytes-total", "SXREPORTING_MAX_AGGREGATE_BYTES_TOTAL",
     &L::maxAggregateBytesTotal, Applies::kNextRequest, "the same for all sessions together"},
    {"max-pending-standalone-bytes", "SXREPORTING_MAX_PENDING_STANDALONE_BYTES",
     &L::maxPendingStandaloneBytes, Applies::kNextConnection,
     "payload bytes of one client's standalone sends waiting for\ntheir delay; further ones are "
     "refused"},
    {"max-payload-bytes", "SXREPORTING_MAX_PAYLOAD_BYTES", &L::maxPayloadBytes,
     Applies::kNextRequest,
     "a message's payload, MessagePack bytes; larger ones get an\nerror reply"},
    {"max-configuration-bytes", "SXREPORTING_MAX_CONFIGURATION_BYTES", &L::maxConfigurationBytes,
     Applies::kNextRequest, "a session's configuration, likewise"},
    {"max-reporter-ids", "SXREPORTING_MAX_REPORTER_IDS", &L::maxReporterIDs, Applies::kNextRequest,
     "reporter IDs in one send's list, likewise"},
    {"max-queued-requests", "SXREPORTING_MAX_QUEUED_REQUESTS", &L::maxQueuedRequests,
     Applies::kRestart,
     "requests of one connection read but not yet handled before\nthe daemon stops reading it"},
    {"max-pending-reply-bytes", "SXREPORTING_MAX_PENDING_REPLY_BYTES", &L::maxPendingReplyBytes,
     Applies::kRestart,
     "replies of one connection waiting to be written before the\ndaemon stops reading it"},
    {"max-connection-bytes", "SXREPORTING_MAX_CONNECTION_BYTES", &L::maxConnectionBytes,
     Applies::kRestart,
     "bytes one connection may make the daemon hold (requests and\npayloads not yet stored) "
     "before it stops reading it"},
    {"max-inflight-bytes", "SXREPORTING_MAX_INFLIGHT_BYTES", &L::maxInflightBytes,
     Applies::kRestart,
     "the same for all connections together; beyond it the\nconnections holding the most stop "
     "being read"},
    {"partial-frame-timeout-ms", "SXREPORTING_PARTIAL_FRAME_TIMEOUT_MS", &L::partialFrameTimeoutMs,
     Applies::kRestart,
     "time a request that has begun to arrive may take to complete;\nthen its connection ends"},
    {"max-error-lines", "SXREPORTING_MAX_ERROR_LINES", &L::maxErrorLines, Applies::kNextConnection,
     "error lines one client may cause a minute; the rest are\ncounted in one line"},
    {"max-connections-per-client", "SXREPORTING_MAX_CONNECTIONS_PER_CLIENT",
     &L::maxConnectionsPerClient, Applies::kNextRequest,
     "open connections of one process; further ones are closed\nat once"},
};

const SXReportingLimitOption* findLimit(const std::string& name) {
  for (const auto& option : kLimitOptions) {
    if (name == option.name) return &option;
  }
  return nullptr;
}

}  // namespace

std::span<const SXReportingLimitOption> SXReportingLimitOptions() { return kLimitOptions; }

SXReportingConfigFile::SXReportingConfigFile(std::string path, std::shared_ptr<SXLogFacility> log)
    : path_(std::move(path)), log_(SXLogOrDiscard(std::move(log))) {}

bool SXReportingConfigFile::load() const {
  SXValue file = SXValue::object();
  std::ifstream in(path_);
  if (in) {
    std::stringstream text;
    text << in.rdbuf();
    file = SXValue::parse(text.str(), nullptr, false);
    if (in.bad() || !file.is_object()) {
      SXLOG(*log_, nullptr, SXLogLevel::kError,
            "%@: not a JSON object; the configuration stays as it was", path_);
      return false;
    }
  }
  bool ok = true;
  for (const auto& read : readers_) ok = read(file) && ok;
  return ok;
}

SXReportingLimitsSection::SXReportingLimitsSection(
    std::shared_ptr<SXReportingEnvironment> environment, std::set<std::string> fixed)
    : environment_(std::move(environment)),
      fixed_(std::move(fixed)),
      flags_(environment_->limits()) {}

std::optional<SXReportingLimits> SXReportingLimitsSection::parse(const SXValue& file,
                                                                 SXReportingLimits base) const {
  auto section = file.find("limits");
  if (section == file.end()) return base;
  SXLogFacility& log = environment_->log();
  if (!section->is_object()) {
    SXLOG(log, nullptr, SXLogLevel::kError, "\"limits\" is not an object; the limits stay");
    return std::nullopt;
  }
  for (const auto& [key, value] : section->items()) {
    const SXReportingLimitOption* option = findLimit(key);
    if (!option) {
      SXLOG(log, nullptr, SXLogLevel::kError, "\"limits\": unknown limit \"%@\"; the limits stay",
            key);
      return std::nullopt;
    }
    bool positive = value.is_number_unsigned()
                        ? value.get<uint64_t>() > 0
                        : value.is_number_integer() && value.get<int64_t>() > 0;
    if (!positive) {
      SXLOG(log, nullptr, SXLogLevel::kError,
            "\"limits\": %@ is %@, not a positive integer; the limits stay", key, value);
      return std::nullopt;
    }
    if (!fixed_.count(key)) base.*option->member = value.get<uint64_t>();
  }
  return base;
}

bool SXReportingLimitsSection::read(const SXValue& file) {
  auto parsed = parse(file, flags_);
  if (!parsed) return false;
  SXReportingLimits current = environment_->limits();
  SXLogFacility& log = environment_->log();
  for (const auto& option : kLimitOptions) {
    uint64_t was = current.*option.member, now = (*parsed).*option.member;
    if (was == now) continue;
    if (loaded_ && option.applies == SXLimitApplies::kRestart) {
      SXLOG(log, nullptr, SXLogLevel::kDefault,
            "limit %s changed to %llu; it applies at the next start (now %llu)", option.name,
            static_cast<unsigned long long>(now), static_cast<unsigned long long>(was));
      (*parsed).*option.member = was;
      continue;
    }
    if (loaded_) {
      SXLOG(
          log, nullptr, SXLogLevel::kDefault, "limit %s: %llu (was %llu)%s", option.name,
          static_cast<unsigned long long>(now), static_cast<unsigned long long>(was),
          option.applies == SXLimitApplies::kNextConnection ? ", for connections opened now" : "");
    }
  }
  loaded_ = true;
  environment_->setLimits(*parsed);
  return true;
}
