// Server reporting (FernReporting): sessions with backends, messages, flushes, and single
// messages that carry their own session info. The service's daemon is "fernreportingd".
//
// All methods may be called from any thread. Completions run later on threads of the service.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "sxreporting/types.h"

// The service's own session-info and user-info keys.
namespace fern {
inline constexpr const char* kSessionInfoClientType = "ClientType";
inline constexpr const char* kSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kSessionInfoSessionID = "SessionID";
inline constexpr const char* kSessionInfoBatchEvent = "BatchEvent";
inline constexpr const char* kSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr const char* kUserInfoClientName = "ClientName";
inline constexpr const char* kUserInfoServiceName = "ServiceName";
}  // namespace fern

struct FernError {
  std::string localizedDescription;
};

// A hierarchy token; its identifier travels in session info.
class FernSecureHierarchyToken {
 public:
  explicit FernSecureHierarchyToken(std::string identifier) : identifier_(std::move(identifier)) {}
  const std::string& identifier() const { return identifier_; }

 private:
  std::string identifier_;
};

// One message of FernReportingSession::sendMessages; what it points to outlives the call.
struct FernMessage {
  uint16_t category;
  uint16_t type;
  // The payload, or null when `payloadJson` holds it: a service that stores JSON takes the
  // text as it is, and the default sendMessages reads the dictionary back from it.
  const SXValue* payload;
  // The payload as compact JSON (SXValueText), when the caller already has it.
  std::shared_ptr<const std::string> payloadJson;
};

struct FernSendOutcome {
  bool sent = false;
  std::optional<FernError> error;  // may be set when not sent
};

using FernBackendsCompletion = std::function<void(std::optional<std::vector<std::string>>)>;
using FernFlushCompletion = std::function<void(std::optional<FernError>)>;

class FernReportingSession {
 public:
  virtual ~FernReportingSession() = default;
  virtual std::string description() const = 0;
  // Calls `completion` once, later, on a thread of the service, with the backends it found.
  virtual void startConfiguration(FernBackendsCompletion completion) = 0;
  // Sends one message. On failure returns false and may set `error`.
  virtual bool sendMessage(uint16_t category, uint16_t type, const SXValue& payload,
                           std::optional<FernError>& error) = 0;
  // Sends several messages, in order, as sendMessage would one after another; a service may
  // store them together. Returns one outcome per message, in the same order.
  virtual std::vector<FernSendOutcome> sendMessages(const std::vector<FernMessage>& messages) {
    std::vector<FernSendOutcome> outcomes(messages.size());
    for (size_t i = 0; i < messages.size(); ++i) {
      const FernMessage& message = messages[i];
      SXValue parsed = message.payload ? SXValue() : SXValue::parse(*message.payloadJson);
      outcomes[i].sent = sendMessage(message.category, message.type,
                                     message.payload ? *message.payload : parsed,
                                     outcomes[i].error);
    }
    return outcomes;
  }
  // Calls `completion` later with an error, or with nothing on success.
  virtual void flushMessages(FernFlushCompletion completion) = 0;
};

class FernReporting {
 public:
  virtual ~FernReporting() = default;
  // A new token under `parent` (nullptr: none). Returns nullptr when none can be made.
  virtual std::shared_ptr<FernSecureHierarchyToken> newHierarchyToken(
      const std::shared_ptr<FernSecureHierarchyToken>& parent) = 0;
  // Opens a session. Returns nullptr on failure.
  virtual std::shared_ptr<FernReportingSession> openSession(const SXValue& sessionInfo,
                                                            const SXValue& userInfo,
                                                            const SXValue& frameworksToCheck) = 0;
  // Sends one message with its own session info. On failure returns false and may set `error`.
  virtual bool sendOneMessage(const SXValue& sessionInfo, const SXValue& userInfo,
                              uint16_t category, uint16_t type, const SXValue& payload,
                              std::optional<FernError>& error) = 0;
};
