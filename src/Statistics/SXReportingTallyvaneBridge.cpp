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

// Held while the message is routed, so that a store done with the text early (the session's
// send task) does not let it go before the first event asks.
SXReportingEventTexts::SXReportingEventTexts(std::shared_ptr<const SXValue> payload,
                                             std::shared_ptr<SXPayloadTextSource> source)
    : payload_(std::move(payload)), source_(std::move(source)) {
  if (source_) source_->hold();
}

SXReportingEventTexts::~SXReportingEventTexts() {
  if (source_) source_->release();
}

SXPayloadTextProvider SXReportingEventTexts::textForHost(const SXValue& host) {
  auto it = std::find_if(texts_.begin(), texts_.end(),
                         [&](const std::shared_ptr<Text>& text) { return text->host == host; });
  std::shared_ptr<Text> text;
  if (it != texts_.end()) {
    text = *it;
  } else {
    text = texts_.emplace_back(std::make_shared<Text>(host));
    if (source_) source_->hold();  // released when the event's text is first made
  }
  return [payload = payload_, source = source_, text] {
    SXMutexLock lock(text->mutex);
    if (!text->text && source) {
      if (auto own = source->payloadText()) {
        text->text = SXDictionaryTextWithMember(*own, kHostKey, text->host);
      }
      source->release();
    }
    if (!text->text) text->text = SXValueTextWithMember(*payload, kHostKey, text->host);
    return *text->text;
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
        SXValue copy = payload->is_object() ? *payload : SXValue::object();
        copy[kHostKey] = host;
        return copy;
      },
      // A store of JSON text gets the same payload's text without the copy.
      std::move(text));
}
