// Records everything asked of the server-reporting service in one ordered list: tokens made,
// sessions opened (with their session info and user info), configurations started, messages
// per session, single messages and flushes.
//
// Tests choose the backends a configuration finds, how its completion (and, separately, a
// flush's) is delivered: at once from a thread of the fake, after a delay on that thread, or
// never (held until deliverHeld()), and whether sends fail, with or without an error.
// Completions still undelivered when the fake is destroyed are dropped; sessions that outlive
// the fake fail their sends and complete nothing.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/FernReporting.h"

class FakeFernReporting final : public FernReporting {
 public:
  // kImmediate: from the fake's thread at once; kInline: on the caller's thread before the
  // call returns; kDelayed: from the fake's thread after the delay; kNever: when the test calls
  // deliverHeld().
  enum class Delivery { kImmediate, kInline, kDelayed, kNever };

  struct Event {
    enum class Kind { kToken, kOpen, kStartConfiguration, kMessage, kSingleMessage, kFlush };
    Kind kind{};
    int session = 0;      // 1, 2, ... in the order sessions were opened; 0 for none
    std::string token{};  // kToken: the new identifier; kOpen: the session info's token
    SXValue sessionInfo{};
    SXValue userInfo{};
    uint16_t category = 0;
    uint16_t type = 0;
    SXValue payload{};
    bool accepted = true;  // sends: what the fake answered
  };

  struct SendFailure {
    bool fails = false;
    std::optional<FernError> error;
  };

  FakeFernReporting();
  ~FakeFernReporting() override;

  std::shared_ptr<FernSecureHierarchyToken> newHierarchyToken(
      const std::shared_ptr<FernSecureHierarchyToken>& parent) override;
  std::shared_ptr<FernReportingSession> openSession(const SXValue& sessionInfo,
                                                    const SXValue& userInfo,
                                                    const SXValue& frameworksToCheck) override;
  bool sendOneMessage(const SXValue& sessionInfo, const SXValue& userInfo, uint16_t category,
                      uint16_t type, const SXValue& payload,
                      std::optional<FernError>& error) override;

  // Configuration: default backends ["fake"], delivered at once.
  void setBackends(std::optional<std::vector<std::string>> backends);
  void setConfigurationDelivery(Delivery delivery,
                                std::chrono::milliseconds delay = std::chrono::milliseconds(0));
  void setFlushDelivery(Delivery delivery,
                        std::chrono::milliseconds delay = std::chrono::milliseconds(0));
  void setFlushError(std::optional<FernError> error);
  void setMessageFailure(SendFailure failure);        // sendMessage on a session
  void setSingleMessageFailure(SendFailure failure);  // sendOneMessage
  void setOpenFails(bool fails);
  void setTokenFails(bool fails);
  // Delivers the completions held under kNever, now, from the fake's thread.
  void deliverHeld();

  std::vector<Event> events() const;
  std::vector<Event> events(Event::Kind kind) const;
  // Messages sent on session `session` (see Event::session).
  std::vector<Event> messages(int session) const;
  // Waits until `ready` holds for the event list; false when `timeout` passes first.
  bool waitFor(const std::function<bool(const std::vector<Event>&)>& ready,
               std::chrono::milliseconds timeout) const;

 private:
  class State;
  class Session;
  // Sessions refer to the state weakly: once the fake is gone they answer as failing.
  std::shared_ptr<State> state_;
};
