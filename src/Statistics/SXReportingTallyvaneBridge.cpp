#include "SXReportingTallyvaneBridge.h"

#include <algorithm>

#include "SXReportingUtility.h"
#include "common/SXValueText.h"

namespace {
const std::string kHostKey = "HostApplicationDisplayID";
}  // namespace

std::string SXReportingTallyvaneBridge::eventName(SXReportingCategory category,
                                                  SXReportingMessageType type) {
  return "com.vendra.sonex." + SXReportingUtilityCategoryName(category) + "." +
         SXReportingUtilityTypeName(type);
}

std::shared_ptr<const std::string> SXReportingEventTexts::Event::get() {
  SXMutexLock lock(mutex);
  if (!text) {
    text = std::make_shared<const std::string>(
        SXPackedDictionaryText(*payload, false, SXTextMember{kHostKey, &host}));
  }
  return text;
}

SXValue SXReportingEventTexts::Event::value() const {
  SXValue copy = payload->isDictionary() ? payload->value() : SXValue::object();
  copy[kHostKey] = host;
  return copy;
}

std::shared_ptr<SXReportingEventTexts::Event> SXReportingEventTexts::forHost(const SXValue& host) {
  auto it = std::find_if(events_.begin(), events_.end(),
                         [&](const std::shared_ptr<Event>& event) { return event->host == host; });
  if (it != events_.end()) return *it;
  return events_.emplace_back(std::make_shared<Event>(host, payload_));
}

void SXReportingTallyvaneBridge::handleEvent(SXReportingEnvironment& environment,
                                             SXReportingEventTexts& texts,
                                             SXReportingCategory category,
                                             SXReportingMessageType type,
                                             const SXReportingEventSession& session) {
  thread_local SXReportingPairNameCache names;
  const std::string& name = names.get(category, type, [&] { return eventName(category, type); });
  auto event = texts.forHost(session.hostApplicationName());
  environment.platform().tallyvane->sendEventLazy(
      name, [event] { return event->value(); },
      // A store of JSON text gets the same payload's text without the copy.
      [event] { return event->get(); });
}
