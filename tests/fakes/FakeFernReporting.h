// Records everything asked of the server-reporting service in one ordered list: tokens made,
// sessions opened (with their session info and user info), configurations started, messages
// per session, single messages and flushes.
//
// A configuration finds the backend "fake" and completes on the caller's thread, or is held
// until deliverHeld(); flushes complete from a thread of the fake. Tests choose whether single
// messages fail, with or without an error. Completions still undelivered when the fake is destroyed
// are dropped; sessions that outlive the fake fail their sends and complete nothing.
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
  // kInline: on the caller's thread before the call returns; kNever: from the fake's thread
  // once the test calls deliverHeld().
  enum class Delivery { kInline, kNever };

  struct Event {
    enum class Kind { kToken, kOpen, kStartConfiguration, kMessage, kSingleMessage, kFlush };
    Kind kind{};
    int session = 0;  // 1, 2, ... in the order sessions were opened; 0 for none
    SXValue sessionInfo{};
    SXValue userInfo{};
    uint16_t category = 0;
    uint16_t type = 0;
    SXValue payload{};
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

  void setConfigurationDelivery(Delivery delivery);
  void setSingleMessageFailure(SendFailure failure);  // sendOneMessage
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
