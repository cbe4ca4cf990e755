// The C interface (sxreporting.h) over SXReportingClient: argument conversion, blocking on the
// C++ futures, and a wall that no exception crosses.
#include <cstdlib>
#include <cstring>
#include <exception>
#include <map>
#include <mutex>
#include <new>
#include <string>
#include <thread>

#include "common/SXThreadSafety.h"
#include "sxreporting/client.h"
#include "sxreporting/sxreporting.h"

struct sxr_client {
  explicit sxr_client(std::string socketPath) : client(SXClientOptions{std::move(socketPath)}) {}

  SXReportingClient client;
  SXMutex mutex;
  // One entry per thread that has called, so that threads sharing a client never read each
  // other's errors. A thread writes only its own entry; std::map never moves its nodes.
  std::map<std::thread::id, std::string> lastErrors SX_GUARDED_BY(mutex);
};

namespace {

// Nested containers the service accepts inside a request's params.
constexpr int kMaxJsonDepth = 32;

const char kOutOfMemory[] = "out of memory";
const char kNoClient[] = "no client (memory or threads ran out)";

std::string* errorSlot(sxr_client* c) {
  SXMutexLock lock(c->mutex);
  return &c->lastErrors[std::this_thread::get_id()];
}

// Records why a call failed. Must not throw: it runs in the handlers that stop exceptions.
sxr_status fail(sxr_client* c, sxr_status status, const char* why) noexcept {
  try {
    *errorSlot(c) = why;
  } catch (...) {  // out of memory: the status alone has to do
  }
  return status;
}

sxr_status succeed(sxr_client* c) noexcept {
  try {
    errorSlot(c)->clear();
  } catch (...) {
  }
  return SXR_OK;
}

sxr_status statusOf(SXCallStatus status) {
  switch (status) {
    case SXCallStatus::kReplied:
      return SXR_OK;
    case SXCallStatus::kTimedOut:
      return SXR_TIMEOUT;
    case SXCallStatus::kConnectionLost:
      return SXR_CONNECTION_LOST;
    case SXCallStatus::kRemoteError:
    case SXCallStatus::kBadReply:
      break;
  }
  return SXR_ERROR;
}

SXTimeout timeoutOf(int64_t milliseconds) {
  if (milliseconds == SXR_TIMEOUT_DEFAULT) return std::nullopt;
  if (milliseconds < 0) return kSXWaitForever;
  return std::chrono::milliseconds(milliseconds);
}

// Runs one C entry point's body; every exception becomes SXR_ERROR with its text.
template <typename Body>
sxr_status guarded(sxr_client* c, Body body) noexcept {
  if (c == nullptr) return SXR_ERROR;
  try {
    return body();
  } catch (const std::bad_alloc&) {
    return fail(c, SXR_ERROR, kOutOfMemory);
  } catch (const std::exception& e) {
    return fail(c, SXR_ERROR, e.what());
  } catch (...) {
    return fail(c, SXR_ERROR, "unexpected failure");
  }
}

// Waits for the reply; on success hands it to `store`, which fills the out-parameters.
template <typename T, typename Store>
sxr_status finish(sxr_client* c, std::future<SXCallResult<T>> future, Store store) {
  SXCallResult<T> result = future.get();
  if (!result.replied()) {
    std::string why = result.error.empty() ? SXCallStatusName(result.status) : result.error;
    if (result.status == SXCallStatus::kRemoteError) why = "request rejected: " + why;
    return fail(c, statusOf(result.status), why.c_str());
  }
  store(result.value);
  return succeed(c);
}

auto storeBool(bool* out) {
  return [out](bool value) {
    if (out) *out = value;
  };
}

// Parses a message or configuration. Depth is checked while parsing (the parser itself does
// not recurse), so that an absurdly nested text cannot reach the recursive encoder.
bool parseObject(const char* text, const char* what, bool nullAllowed, SXValue& out,
                 std::string& error) {
  if (text == nullptr) {
    if (nullAllowed) return out = nullptr, true;
    error = std::string(what) + " is NULL";
    return false;
  }
  bool tooDeep = false;
  auto limitDepth = [&tooDeep](int depth, SXValue::parse_event_t event, SXValue&) {
    const bool opens = event == SXValue::parse_event_t::object_start ||
                       event == SXValue::parse_event_t::array_start;
    if (opens && depth >= kMaxJsonDepth) tooDeep = true;
    return !tooDeep;
  };
  out = SXValue::parse(text, limitDepth, false);
  if (tooDeep) {
    error =
        std::string(what) + " is nested deeper than " + std::to_string(kMaxJsonDepth) + " levels";
  } else if (out.is_discarded()) {
    error = std::string(what) + " is not valid JSON";
  } else if (!out.is_object() && !(nullAllowed && out.is_null())) {
    error = std::string(what) +
            (nullAllowed ? " is not a JSON object or null" : " is not a JSON object");
  } else {
    return true;
  }
  return false;
}

char* copyString(const std::string& text) {
  auto* copy = static_cast<char*>(std::malloc(text.size() + 1));
  if (copy == nullptr) throw std::bad_alloc();
  std::memcpy(copy, text.c_str(), text.size() + 1);
  return copy;
}

}  // namespace

extern "C" {

sxr_status sxr_client_connect(const char* socket_path, sxr_client** out_client) {
  if (out_client == nullptr) return SXR_ERROR;
  *out_client = nullptr;
  try {
    auto client = std::make_unique<sxr_client>(socket_path ? socket_path : "");
    *out_client = client.release();
  } catch (...) {
    return SXR_ERROR;  // sxr_client_last_error(NULL) explains
  }
  return guarded(*out_client, [c = *out_client] {
    std::string error;
    if (!c->client.connect(&error)) return fail(c, SXR_CONNECTION_LOST, error.c_str());
    return succeed(c);
  });
}

void sxr_client_close(sxr_client* client) {
  try {
    std::unique_ptr<sxr_client> owned(client);
  } catch (...) {  // a destructor that throws: nothing a C caller could do about it
  }
}

const char* sxr_client_last_error(const sxr_client* client) {
  if (client == nullptr) return kNoClient;
  try {
    return errorSlot(const_cast<sxr_client*>(client))->c_str();
  } catch (...) {
    return kOutOfMemory;
  }
}

const char* sxr_client_socket_path(const sxr_client* client) {
  return client ? client->client.socketPath().c_str() : "";
}

const char* sxr_status_name(sxr_status status) {
  switch (status) {
    case SXR_OK:
      return "ok";
    case SXR_TIMEOUT:
      return "timeout";
    case SXR_CONNECTION_LOST:
      return "connection lost";
    case SXR_ERROR:
      return "error";
  }
  return "unknown status";
}

void sxr_free(void* pointer) { std::free(pointer); }

sxr_status sxr_create_reporting_session(sxr_client* c, int64_t reporter_id, int64_t timeout_ms,
                                        bool* out_result) {
  return guarded(c, [&] {
    return finish(c, c->client.createReportingSession(reporter_id, timeoutOf(timeout_ms)),
                  storeBool(out_result));
  });
}

sxr_status sxr_set_service_type(sxr_client* c, uint16_t service_type, int64_t reporter_id,
                                int64_t timeout_ms, bool* out_result) {
  return guarded(c, [&] {
    return finish(c, c->client.setServiceType(service_type, reporter_id, timeoutOf(timeout_ms)),
                  storeBool(out_result));
  });
}

sxr_status sxr_get_service_name_for_reporter_id(sxr_client* c, int64_t reporter_id,
                                                int64_t timeout_ms, uint16_t* out_service_type) {
  return guarded(c, [&] {
    return finish(c, c->client.getServiceNameForReporterID(reporter_id, timeoutOf(timeout_ms)),
                  [out_service_type](SXReportingServiceType type) {
                    if (out_service_type) *out_service_type = type;
                  });
  });
}

sxr_status sxr_set_configuration(sxr_client* c, const char* configuration_json, int64_t reporter_id,
                                 int64_t timeout_ms, bool* out_result) {
  return guarded(c, [&] {
    SXValue configuration;
    std::string error;
    if (!parseObject(configuration_json, "the configuration", true, configuration, error)) {
      return fail(c, SXR_ERROR, error.c_str());
    }
    std::optional<SXValue> sent;
    if (!configuration.is_null()) sent = std::move(configuration);
    return finish(c,
                  c->client.setConfiguration(std::move(sent), reporter_id, timeoutOf(timeout_ms)),
                  storeBool(out_result));
  });
}

sxr_status sxr_start_reporting_session_for_id(sxr_client* c, int64_t reporter_id,
                                              int64_t timeout_ms, bool* out_result) {
  return guarded(c, [&] {
    return finish(c, c->client.startReportingSessionForID(reporter_id, timeoutOf(timeout_ms)),
                  storeBool(out_result));
  });
}

sxr_status sxr_send_message(sxr_client* c, const char* message_json, uint32_t category,
                            uint16_t type, const int64_t* reporter_ids, size_t reporter_id_count,
                            int64_t timeout_ms, bool* out_delivered) {
  return guarded(c, [&] {
    SXValue message;
    std::string error;
    if (!parseObject(message_json, "the message", false, message, error)) {
      return fail(c, SXR_ERROR, error.c_str());
    }
    if (reporter_ids == nullptr && reporter_id_count != 0) {
      return fail(c, SXR_ERROR, "reporter_ids is NULL but reporter_id_count is not 0");
    }
    std::optional<std::vector<int64_t>> ids;
    if (reporter_ids) ids.emplace(reporter_ids, reporter_ids + reporter_id_count);
    return finish(c,
                  c->client.sendMessage(std::move(message), category, type, std::move(ids),
                                        timeoutOf(timeout_ms)),
                  [out_delivered](const std::optional<SXError>& refused) {
                    if (out_delivered) *out_delivered = !refused.has_value();
                  });
  });
}

sxr_status sxr_stop_reporting_session_for_id(sxr_client* c, int64_t reporter_id, int64_t timeout_ms,
                                             bool* out_result) {
  return guarded(c, [&] {
    return finish(c, c->client.stopReportingSessionForID(reporter_id, timeoutOf(timeout_ms)),
                  storeBool(out_result));
  });
}

sxr_status sxr_destroy_reporting_session(sxr_client* c, int64_t reporter_id, int64_t timeout_ms,
                                         bool* out_result) {
  return guarded(c, [&] {
    return finish(c, c->client.destroyReportingSession(reporter_id, timeoutOf(timeout_ms)),
                  storeBool(out_result));
  });
}

sxr_status sxr_reporter_id_valid(sxr_client* c, int64_t reporter_id, int64_t timeout_ms,
                                 int64_t* out_reporter_id, uint16_t* out_service_type) {
  return guarded(c, [&] {
    return finish(c, c->client.reporterID(reporter_id, timeoutOf(timeout_ms)),
                  [&](const SXReporterIDValidity& validity) {
                    if (out_reporter_id) *out_reporter_id = validity.reporterID;
                    if (out_service_type) *out_service_type = validity.serviceType;
                  });
  });
}

sxr_status sxr_get_all_reporters(sxr_client* c, int64_t timeout_ms, int64_t** out_ids,
                                 size_t* out_count) {
  return guarded(c, [&] {
    return finish(c, c->client.getAllReporters(timeoutOf(timeout_ms)),
                  [&](const std::vector<int64_t>& ids) {
                    int64_t* copy = nullptr;
                    if (out_ids && !ids.empty()) {
                      copy = static_cast<int64_t*>(std::malloc(ids.size() * sizeof(int64_t)));
                      if (copy == nullptr) throw std::bad_alloc();
                      std::memcpy(copy, ids.data(), ids.size() * sizeof(int64_t));
                    }
                    if (out_ids) *out_ids = copy;
                    if (out_count) *out_count = ids.size();
                  });
  });
}

sxr_status sxr_kill_service(sxr_client* c, int64_t timeout_ms) {
  return guarded(
      c, [&] { return finish(c, c->client.killService(timeoutOf(timeout_ms)), [](bool) {}); });
}

sxr_status sxr_get_status(sxr_client* c, int64_t timeout_ms, char** out_json) {
  return guarded(c, [&] {
    return finish(c, c->client.status(timeoutOf(timeout_ms)), [out_json](const SXValue& status) {
      if (out_json) {
        *out_json = copyString(status.dump(-1, ' ', false, SXValue::error_handler_t::replace));
      }
    });
  });
}

}  // extern "C"
