// Turns a message delivered to a session into an analytics event named after its category and
// type, "com.vendra.sonex.<category>.<type>", with the host application's name added.
// Stateless; runs on its caller's thread.
#pragma once

#include <functional>
#include <mutex>
#include <optional>
#include <vector>

#include "SXReportingEnvironment.h"
#include "SXReportingEventSession.h"
#include "common/SXPackedValue.h"
#include "common/SXThreadSafety.h"

// The analytics events of one message: their payloads differ only in the host name, so each
// distinct host's text is made once (when the analytics service first asks for it, on its
// thread), however many sessions the message goes to. Used on the server queue; lives while
// the message is routed.
class SXReportingEventTexts {
 public:
  explicit SXReportingEventTexts(std::shared_ptr<const SXPackedValue> payload)
      : payload_(std::move(payload)) {}
  SXReportingEventTexts(const SXReportingEventTexts&) = delete;
  SXReportingEventTexts& operator=(const SXReportingEventTexts&) = delete;

  // The event of a session whose host is `host`.
  struct Event {
    Event(SXValue h, std::shared_ptr<const SXPackedValue> p)
        : host(std::move(h)), payload(std::move(p)) {}
    // Its text, made by the first to ask.
    std::shared_ptr<const std::string> get();
    // Its payload, made on each call.
    SXValue value() const;

    const SXValue host;
    const std::shared_ptr<const SXPackedValue> payload;
    SXMutex mutex;
    std::shared_ptr<const std::string> text SX_GUARDED_BY(mutex);
  };
  std::shared_ptr<Event> forHost(const SXValue& host);

 private:
  std::shared_ptr<const SXPackedValue> payload_;
  std::vector<std::shared_ptr<Event>> events_;  // one per host seen; few
};

class SXReportingTallyvaneBridge {
 public:
  // The message's payload is never changed by anyone, so the event's text or copy of it (with
  // the host name) is made when the analytics service asks for it, on the service's thread.
  static void handleEvent(SXReportingEnvironment& environment, SXReportingEventTexts& texts,
                          SXReportingCategory category, SXReportingMessageType type,
                          const SXReportingEventSession& session);
  static std::string eventName(SXReportingCategory category, SXReportingMessageType type);
};
