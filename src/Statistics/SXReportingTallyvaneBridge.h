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
  const std::shared_ptr<const SXPackedValue>& payload() const { return payload_; }
  // The event text for a session whose host is `host`.
  SXPayloadTextProvider textForHost(const SXValue& host);

 private:
  struct Text {
    explicit Text(SXValue h) : host(std::move(h)) {}
    const SXValue host;
    SXMutex mutex;
    std::shared_ptr<const std::string> text SX_GUARDED_BY(mutex);  // made by the first to ask
  };
  std::shared_ptr<const SXPackedValue> payload_;
  std::vector<std::shared_ptr<Text>> texts_;  // one per host seen; few
};

class SXReportingTallyvaneBridge {
 public:
  // `texts.payload()` is never changed by anyone, so the event's copy of it (with the host
  // name) is made when the analytics service asks for it, on the service's thread.
  static void handleEvent(SXReportingEnvironment& environment, SXReportingEventTexts& texts,
                          SXReportingCategory category, SXReportingMessageType type,
                          const SXReportingEventSession& session);
  static std::string eventName(SXReportingCategory category, SXReportingMessageType type);
};
