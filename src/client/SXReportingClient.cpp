#include "client/SXRpcChannel.h"
#include "common/SXPaths.h"
#include "sxreporting/client.h"

namespace {

std::optional<int64_t> asInt64(const SXValue& v) {
  if (v.is_number_unsigned()) {
    auto u = v.get<uint64_t>();
    if (u > static_cast<uint64_t>(INT64_MAX)) return std::nullopt;
    return static_cast<int64_t>(u);
  }
  if (v.is_number_integer()) return v.get<int64_t>();
  return std::nullopt;
}

std::optional<SXReportingServiceType> asServiceType(const SXValue& v) {
  auto n = asInt64(v);
  if (!n || *n < 0 || *n > 0xFFFF) return std::nullopt;
  return static_cast<SXReportingServiceType>(*n);
}

// Each operation's reply, read from the wire value; nothing when it has the wrong shape.
template <typename T>
std::optional<T> decodeReply(const SXValue& v);

template <>
std::optional<SXValue> decodeReply(const SXValue& v) {
  return v;
}

template <>
std::optional<bool> decodeReply(const SXValue& v) {
  if (!v.is_boolean()) return std::nullopt;
  return v.get<bool>();
}

template <>
std::optional<SXReportingServiceType> decodeReply(const SXValue& v) {
  return asServiceType(v);
}

template <>
std::optional<std::optional<SXError>> decodeReply(const SXValue& v) {
  if (v.is_null()) return std::optional<SXError>();
  if (!v.is_object() || !v.contains("domain") || !v["domain"].is_string()) return std::nullopt;
  auto code = v.contains("code") ? asInt64(v["code"]) : std::nullopt;
  if (!code) return std::nullopt;
  return std::optional<SXError>(SXError{v["domain"].get<std::string>(), *code});
}

template <>
std::optional<SXReporterIDValidity> decodeReply(const SXValue& v) {
  if (!v.is_object() || !v.contains("reporterID") || !v.contains("serviceType")) {
    return std::nullopt;
  }
  auto reporterID = asInt64(v["reporterID"]);
  auto serviceType = asServiceType(v["serviceType"]);
  if (!reporterID || !serviceType) return std::nullopt;
  return SXReporterIDValidity{*reporterID, *serviceType};
}

template <>
std::optional<std::vector<int64_t>> decodeReply(const SXValue& v) {
  if (!v.is_array()) return std::nullopt;
  std::vector<int64_t> ids;
  ids.reserve(v.size());
  for (const auto& item : v) {
    auto id = asInt64(item);
    if (!id) return std::nullopt;
    ids.push_back(*id);
  }
  return ids;
}

SXValue idList(const std::optional<std::vector<int64_t>>& ids) {
  if (!ids) return nullptr;
  return SXValue(*ids);
}

}  // namespace

const char* SXCallStatusName(SXCallStatus status) {
  switch (status) {
    case SXCallStatus::kReplied:
      return "replied";
    case SXCallStatus::kRemoteError:
      return "remote error";
    case SXCallStatus::kTimedOut:
      return "timed out";
    case SXCallStatus::kConnectionLost:
      return "connection lost";
    case SXCallStatus::kBadReply:
      return "bad reply";
  }
  return "unknown";
}

SXReportingClient::SXReportingClient(SXClientOptions options) {
  std::string path = options.socketPath.empty() ? SXPaths::fromEnvironment().socketPath
                                                : std::move(options.socketPath);
  impl_ = std::make_shared<SXRpcChannel>(std::move(path), options.defaultTimeout);
  // The thread holds the channel too, so that a client destroyed from one of its own
  // callbacks leaves the channel alive until the loop has wound down.
  thread_ = std::thread([channel = impl_] { channel->run(); });
}

SXReportingClient::~SXReportingClient() {
  impl_->shutdown();
  if (std::this_thread::get_id() == thread_.get_id()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

bool SXReportingClient::connect(std::string* error) {
  if (std::this_thread::get_id() == thread_.get_id()) {
    if (error) *error = "connect() cannot be called from a callback of the same client";
    return false;
  }
  return impl_->connect(error);
}

void SXReportingClient::close() { impl_->close(); }
bool SXReportingClient::connected() const { return impl_->connected(); }
const std::string& SXReportingClient::socketPath() const { return impl_->socketPath(); }

template <typename T>
void SXReportingClient::typedCall(const char* method, SXValue params, SXCallback<T> callback,
                                  SXTimeout timeout) {
  impl_->call(method, params, timeout, [callback = std::move(callback)](SXCallResult<SXValue> raw) {
    SXCallResult<T> result{raw.status, T{}, std::move(raw.error)};
    if (raw.replied()) {
      if (auto value = decodeReply<T>(raw.value)) {
        result.value = std::move(*value);
      } else {
        result.status = SXCallStatus::kBadReply;
        result.error =
            "unexpected reply " + raw.value.dump(-1, ' ', false, SXValue::error_handler_t::replace);
      }
    }
    callback(std::move(result));
  });
}

template <typename T>
std::future<SXCallResult<T>> SXReportingClient::futureCall(const char* method, SXValue params,
                                                           SXTimeout timeout) {
  auto promise = std::make_shared<std::promise<SXCallResult<T>>>();
  auto future = promise->get_future();
  typedCall<T>(
      method, std::move(params),
      [promise](SXCallResult<T> result) { promise->set_value(std::move(result)); }, timeout);
  return future;
}

// Both forms of each operation, from the method name, the params and the reply type.
#define SX_OPERATION(Name, T, Method, Params, ...)                                \
  void SXReportingClient::Name(__VA_ARGS__ __VA_OPT__(, ) SXCallback<T> callback, \
                               SXTimeout timeout) {                               \
    typedCall<T>(Method, Params, std::move(callback), timeout);                   \
  }                                                                               \
  std::future<SXCallResult<T>> SXReportingClient::Name(__VA_ARGS__ __VA_OPT__(, ) \
                                                           SXTimeout timeout) {   \
    return futureCall<T>(Method, Params, timeout);                                \
  }

using namespace sxr::method;
using OptionalError = std::optional<SXError>;
using IDs = std::vector<int64_t>;
using OptionalIDs = std::optional<IDs>;
using OptionalConfig = std::optional<SXValue>;

SX_OPERATION(createReportingSession, bool, kCreate, SXValue::array({reporterID}),
             int64_t reporterID)
SX_OPERATION(setServiceType, bool, kSetServiceType, SXValue::array({serviceType, reporterID}),
             SXReportingServiceType serviceType, int64_t reporterID)
SX_OPERATION(getServiceNameForReporterID, SXReportingServiceType, kGetServiceType,
             SXValue::array({reporterID}), int64_t reporterID)
SX_OPERATION(setConfiguration, bool, kSetConfiguration,
             SXValue::array({configuration.value_or(nullptr), reporterID}),
             OptionalConfig configuration, int64_t reporterID)
SX_OPERATION(startReportingSessionForID, bool, kStart, SXValue::array({reporterID}),
             int64_t reporterID)
SX_OPERATION(sendMessage, OptionalError, kSendMessage,
             SXValue::array({std::move(message), category, type, idList(reporterIDs)}),
             SXValue message, SXReportingCategory category, SXReportingMessageType type,
             OptionalIDs reporterIDs)
SX_OPERATION(stopReportingSessionForID, bool, kStop, SXValue::array({reporterID}),
             int64_t reporterID)
SX_OPERATION(destroyReportingSession, bool, kDestroy, SXValue::array({reporterID}),
             int64_t reporterID)
SX_OPERATION(reporterID, SXReporterIDValidity, kValid, SXValue::array({reporterID}),
             int64_t reporterID)
SX_OPERATION(getAllReporters, IDs, kGetAllReporters, SXValue::array())
SX_OPERATION(killService, bool, kKillService, SXValue::array())
SX_OPERATION(status, SXValue, kStatus, SXValue::array())

void SXReportingClient::call(const std::string& method, SXValue params,
                             SXCallback<SXValue> callback, SXTimeout timeout) {
  typedCall<SXValue>(method.c_str(), std::move(params), std::move(callback), timeout);
}

std::future<SXCallResult<SXValue>> SXReportingClient::call(const std::string& method,
                                                           SXValue params, SXTimeout timeout) {
  return futureCall<SXValue>(method.c_str(), std::move(params), timeout);
}
