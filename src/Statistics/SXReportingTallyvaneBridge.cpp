#include "SXReportingTallyvaneBridge.h"

#include <algorithm>

#include "SXReportingUtility.h"

namespace {
const std::string kHostKey = "HostApplicationDisplayID";
}  // namespace

std::string SXReportingTallyvaneBridge::eventName(SXReportingCategory category,
                                                  SXReportingMessageType type) {
  return "com.vendra.sonex." + SXReportingUtilityCategoryName(category) + "." +
         SXReportingUtilityTypeName(type);
}

SXPayloadTextProvider SXReportingEventTexts::textForHost(const SXValue& host) {
  auto it = std::find_if(texts_.begin(), texts_.end(),
                         [&](const std::shared_ptr<Text>& text) { return text->host == host; });
  std::shared_ptr<Text> text;
  if (it != texts_.end()) {
    text = *it;
  } else {
    text = texts_.emplace_back(std::make_shared<Text>(host, payload_, source_));
  }
  return [text] {
    SXMutexLock lock(text->mutex);
    if (!text->text) {
      const SXTextMember member{kHostKey, &text->host};
      if (text->source) text->text = text->source->eventTextAlongside(member);
      if (!text->text) {
        text->text =
            std::make_shared<const std::string>(SXPackedDictionaryText(*text->payload, false, member));
      }
    }
    return text->text;
  };
}

void SXReportingTallyvaneBridge::handleEvent(SXReportingEnvironment& environment,
                                             SXReportingEventTexts& texts,
                                             SXReportingCategory category,
                                             SXReportingMessageType type,
                                             const SXReportingEventSession& session) {
  thread_local SXReportingPairNameCache names;
  const std::string& name = names.get(category, type, [&] { return eventName(category, type); });
  SXValue host = session.hostApplicationName();
  SXPayloadTextProvider text = texts.textForHost(host);
  environment.platform().tallyvane->sendEventLazy(
      name,
      [payload = texts.payload(), host = std::move(host)] {
        SXValue copy = payload->isDictionary() ? payload->value() : SXValue::object();
        copy[kHostKey] = host;
        return copy;
      },
      // A store of JSON text gets the same payload's text without the copy.
      std::move(text));
}
