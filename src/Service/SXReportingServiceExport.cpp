#include "SXReportingServiceExport.h"

#include <array>
#include <limits>
#include <unordered_set>

#include "SXReportingServiceDelegate.h"
#include "common/MsgpackValue.h"
#include "common/SXValueText.h"

namespace {

enum class Kind {
  kReporterID,
  kServiceType,
  kCategory,
  kMessageType,
  kDictionary,
  kDictionaryOrNil,
  kReporterIDListOrNil
};

struct Signature {
  const char* method;
  std::vector<std::pair<const char*, Kind>> params;
};

const std::array<Signature, 12> kSignatures = {{
    {sxr::method::kCreate, {{"reporterID", Kind::kReporterID}}},
    {sxr::method::kSetServiceType,
     {{"serviceType", Kind::kServiceType}, {"reporterID", Kind::kReporterID}}},
    {sxr::method::kGetServiceType, {{"reporterID", Kind::kReporterID}}},
    {sxr::method::kSetConfiguration,
     {{"configuration", Kind::kDictionaryOrNil}, {"reporterID", Kind::kReporterID}}},
    {sxr::method::kStart, {{"reporterID", Kind::kReporterID}}},
    {sxr::method::kSendMessage,
     {{"message", Kind::kDictionary},
      {"category", Kind::kCategory},
      {"type", Kind::kMessageType},
      {"reporterIDs", Kind::kReporterIDListOrNil}}},
    {sxr::method::kStop, {{"reporterID", Kind::kReporterID}}},
    {sxr::method::kDestroy, {{"reporterID", Kind::kReporterID}}},
    {sxr::method::kValid, {{"reporterID", Kind::kReporterID}}},
    {sxr::method::kGetAllReporters, {}},
    {sxr::method::kKillService, {}},
    {sxr::method::kStatus, {}},
}};

bool isSigned64(const SXValue& v) {
  return v.is_number_integer() &&
         (!v.is_number_unsigned() ||
          v.get<uint64_t>() <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()));
}

std::string checkUnsigned(const SXValue& v, uint64_t max, const char* what) {
  if (!v.is_number_integer()) return std::string("must be ") + what;
  bool negative = !v.is_number_unsigned() && v.get<int64_t>() < 0;
  if (negative || v.get<uint64_t>() > max) {
    return "out of range: " + SXValueText(v) + " (expected 0.." + std::to_string(max) + ")";
  }
  return {};
}

// Empty when `v` is a well-formed param of `kind`, else why it is not.
std::string check(const SXValue& v, Kind kind) {
  switch (kind) {
    case Kind::kReporterID:
      if (!v.is_number_integer()) return "must be a signed 64-bit integer";
      return isSigned64(v)
                 ? ""
                 : "out of range: " + SXValueText(v) + " (expected a signed 64-bit integer)";
    case Kind::kServiceType:
      return checkUnsigned(v, 0xFFFF, "an unsigned 16-bit integer");
    case Kind::kCategory:
      return checkUnsigned(v, 0xFFFFFFFF, "an unsigned 32-bit integer");
    case Kind::kMessageType:
      return checkUnsigned(v, 0xFFFF, "an unsigned 16-bit integer");
    case Kind::kDictionary:
      return v.is_object() ? "" : "must be a dictionary";
    case Kind::kDictionaryOrNil:
      return v.is_object() || v.is_null() ? "" : "must be a dictionary or nil";
    case Kind::kReporterIDListOrNil:
      if (v.is_null()) return "";
      if (!v.is_array()) return "must be an array of reporter IDs or nil";
      for (size_t i = 0; i < v.size(); ++i) {
        if (!isSigned64(v[i])) {
          return "element " + std::to_string(i) +
                 " is not a signed 64-bit reporter ID: " + SXValueText(v[i]);
        }
      }
      return "";
  }
  return "unknown parameter kind";
}

SXValue errorValue(const std::optional<SXError>& error) {
  if (!error) return nullptr;
  return {{"domain", error->domain}, {"code", error->code}};
}

}  // namespace

SXReportingServiceExport::SXReportingServiceExport(
    std::shared_ptr<SXReportingServerInstance> instance,
    std::weak_ptr<SXReportingServiceDelegate> delegate,
    std::shared_ptr<SXReportingEnvironment> environment, std::shared_ptr<SXByteBudget> budget)
    : instance_(std::move(instance)),
      delegate_(std::move(delegate)),
      environment_(std::move(environment)),
      budget_(std::move(budget)) {}

void SXReportingRemoveRepeatedIDs(std::vector<int64_t>& reporterIDs) {
  if (reporterIDs.size() < 2) return;
  std::unordered_set<int64_t> seen;
  seen.reserve(reporterIDs.size());
  std::erase_if(reporterIDs, [&seen](int64_t id) { return !seen.insert(id).second; });
}

namespace {

std::string refusal(SXReportingEnvironment& environment, std::string_view method,
                    SXReportingGuardrail guardrail, const std::string& why) {
  environment.counters().dropped(guardrail);
  return std::string(method) + " " + why;
}

std::string tooLarge(const char* what, size_t size, uint64_t limit, const char* flag) {
  return std::string(what) + " of " + std::to_string(size) + " bytes is larger than the limit of " +
         std::to_string(limit) + " bytes (" + flag + ")";
}

}  // namespace

std::string SXReportingServiceExport::checkLimits(std::string_view method, const SXValue& params,
                                                  size_t wireBytes) {
  if (method != sxr::method::kSetConfiguration) return "";
  const uint64_t limit = environment_->limits().maxConfigurationBytes;
  // A request no larger than the limit cannot hold a larger value, so only larger requests are
  // measured.
  if (wireBytes <= limit) return "";
  size_t size = SXPackedSize(params[0]);
  if (size <= limit) return "";
  return refusal(*environment_, method, SXReportingGuardrail::kConfigurationBytes,
                 tooLarge("configuration", size, limit, "--max-configuration-bytes"));
}

std::string SXReportingServiceExport::checkSendLimits(const Send& send, size_t wireBytes) {
  const SXReportingLimits& limits = environment_->limits();
  if (send.reporterIDs && send.reporterIDs->size() > limits.maxReporterIDs) {
    return refusal(*environment_, sxr::method::kSendMessage, SXReportingGuardrail::kReporterIDs,
                   "reporterIDs holds " + std::to_string(send.reporterIDs->size()) +
                       " reporter IDs, more than the limit of " +
                       std::to_string(limits.maxReporterIDs) + " (--max-reporter-ids)");
  }
  if (wireBytes <= limits.maxPayloadBytes || send.payload.size() <= limits.maxPayloadBytes) {
    return "";
  }
  return refusal(
      *environment_, sxr::method::kSendMessage, SXReportingGuardrail::kPayloadBytes,
      tooLarge("payload", send.payload.size(), limits.maxPayloadBytes, "--max-payload-bytes"));
}

std::optional<SXReportingServiceExport::Send> SXReportingServiceExport::readSend(
    std::string_view params) {
  using Kind = SXPackedReader::Kind;
  // The connection has checked the bytes: one whole array that the value model can hold.
  SXPackedReader reader(params);
  if (reader.next().count != 4) return std::nullopt;
  const char* payload = reader.position();
  if (SXPackedReader(reader).next().kind != Kind::kMap) return std::nullopt;
  reader.skip();
  const std::string_view payloadBytes(payload, reader.position() - payload);
  auto unsignedUpTo = [](const SXPackedReader::Item& item, uint64_t max) {
    return item.kind == Kind::kUnsigned && item.u <= max;
  };
  SXPackedReader::Item category = reader.next();
  SXPackedReader::Item type = reader.next();
  SXPackedReader::Item ids = reader.next();
  if (!unsignedUpTo(category, 0xFFFFFFFF) || !unsignedUpTo(type, 0xFFFF) ||
      (ids.kind != Kind::kNil && ids.kind != Kind::kArray)) {
    return std::nullopt;
  }
  std::optional<std::vector<int64_t>> reporterIDs;
  if (ids.kind == Kind::kArray) {
    reporterIDs.emplace().reserve(ids.count);
    for (uint32_t i = 0; i < ids.count; ++i) {
      SXPackedReader::Item id = reader.next();
      if (id.kind == Kind::kSigned) {
        reporterIDs->push_back(id.i);
      } else if (unsignedUpTo(id, std::numeric_limits<int64_t>::max())) {
        reporterIDs->push_back(static_cast<int64_t>(id.u));
      } else {
        return std::nullopt;
      }
    }
  }
  return Send{SXPackedValue::fromBytes(payloadBytes), static_cast<SXReportingCategory>(category.u),
              static_cast<SXReportingMessageType>(type.u), std::move(reporterIDs)};
}

std::string SXReportingServiceExport::validate(std::string_view method, const SXValue& params) {
  for (const auto& signature : kSignatures) {
    if (method != signature.method) continue;
    size_t expected = signature.params.size();
    if (!params.is_array() || params.size() != expected) {
      return std::string(method) + " takes " + std::to_string(expected) + " param" +
             (expected == 1 ? "" : "s") + ", got " +
             std::to_string(params.is_array() ? params.size() : 0);
    }
    for (size_t i = 0; i < expected; ++i) {
      std::string why = check(params[i], signature.params[i].second);
      if (!why.empty()) {
        return std::string(method) + " param " + std::to_string(i + 1) + " (" +
               signature.params[i].first + ") " + why;
      }
    }
    return "";
  }
  return "unknown method '" + std::string(method) + "'";
}

void SXReportingServiceExport::handleRequest(std::string_view method, SXValue params,
                                             size_t wireBytes, SXIpcReplyFn reply) {
  std::string why = validate(method, params);
  if (why.empty() && method == sxr::method::kSendMessage) {
    std::optional<std::vector<int64_t>> ids;
    if (!params[3].is_null()) ids = params[3].get<std::vector<int64_t>>();
    dispatchSend({SXPackedValue::fromValue(params[0]), params[1].get<SXReportingCategory>(),
                  params[2].get<SXReportingMessageType>(), std::move(ids)},
                 wireBytes, std::move(reply));
    return;
  }
  if (why.empty()) why = checkLimits(method, params, wireBytes);
  if (!why.empty()) {
    reply(why, nullptr);
    return;
  }
  dispatch(method, params, std::move(reply));
}

bool SXReportingServiceExport::handlePackedRequest(std::string_view method, std::string_view params,
                                                   size_t wireBytes, SXIpcReplyFn& reply) {
  if (method != sxr::method::kSendMessage) return false;
  std::optional<Send> send = readSend(params);
  if (!send) return false;
  dispatchSend(std::move(*send), wireBytes, std::move(reply));
  return true;
}

void SXReportingServiceExport::dispatchSend(Send send, size_t wireBytes, SXIpcReplyFn reply) {
  if (std::string why = checkSendLimits(send, wireBytes); !why.empty()) {
    reply(why, nullptr);
    return;
  }
  if (send.reporterIDs) SXReportingRemoveRepeatedIDs(*send.reporterIDs);
  // What a message makes the service hold is about as much as the decoded request took: its
  // packed bytes and the stores' two texts, each about one and a half times its size.
  auto message = SXChargedShared(std::move(send.payload),
                                 SXByteBudget::Charge(budget_, SXDecodedBytes(wireBytes)));
  instance_->sendMessage(std::move(message), send.category, send.type, std::move(send.reporterIDs),
                         [reply = std::move(reply)](std::optional<SXError> error) {
                           reply(nullptr, errorValue(error));
                         });
}

// Moves what it hands on out of `params`.
void SXReportingServiceExport::dispatch(std::string_view method, SXValue& params,
                                        SXIpcReplyFn reply) {
  auto boolReply = [reply](bool value) { reply(nullptr, value); };
  auto& instance = *instance_;
  if (method == sxr::method::kCreate) {
    instance.createReportingSession(params[0].get<int64_t>(), boolReply);
  } else if (method == sxr::method::kSetServiceType) {
    instance.setServiceType(params[0].get<SXReportingServiceType>(), params[1].get<int64_t>(),
                            boolReply);
  } else if (method == sxr::method::kGetServiceType) {
    instance.getServiceNameForReporterID(
        params[0].get<int64_t>(), [reply](SXReportingServiceType type) { reply(nullptr, type); });
  } else if (method == sxr::method::kSetConfiguration) {
    std::optional<SXValue> configuration;
    if (!params[0].is_null()) configuration = std::move(params[0]);
    instance.setConfiguration(std::move(configuration), params[1].get<int64_t>(), boolReply);
  } else if (method == sxr::method::kStart) {
    instance.startReportingSessionForID(params[0].get<int64_t>(), boolReply);
  } else if (method == sxr::method::kStop) {
    instance.stopReportingSessionForID(params[0].get<int64_t>(), boolReply);
  } else if (method == sxr::method::kDestroy) {
    instance.destroyReportingSession(params[0].get<int64_t>(), boolReply);
  } else if (method == sxr::method::kValid) {
    instance.reporterID(params[0].get<int64_t>(),
                        [reply](SXValue valid) { reply(nullptr, valid); });
  } else if (method == sxr::method::kGetAllReporters) {
    instance.getAllReporters([reply](std::vector<int64_t> ids) { reply(nullptr, SXValue(ids)); });
  } else if (method == sxr::method::kKillService) {
    instance.killService(boolReply);
  } else if (method == sxr::method::kStatus) {
    environment_->serverQueue()->async([delegate = delegate_, reply] {
      auto strong = delegate.lock();
      reply(nullptr, strong ? strong->statusSnapshot() : SXValue());
    });
  }
}
