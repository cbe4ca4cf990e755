#include "fakes/FakeKestrel.h"


namespace {

using Name = FakeKestrel::Name;

class FakeSubscription final : public KestrelSubscription {
 public:
  explicit FakeSubscription(SXValue query) : query(std::move(query)) {}
  const SXValue query;
};

SXValue toValue(const Name& name) { return name ? SXValue(*name) : SXValue(); }

Name toName(const SXValue& value) {
  return value.is_string() ? Name(value.get<std::string>()) : std::nullopt;
}

SXValue queryValue(const Name& group, const Name& subgroup) {
  return {{"group", toValue(group)}, {"subgroup", toValue(subgroup)}};
}

// The query that a channel dictionary, subscription or samples value descends from.
SXValue queryIn(const SXValue& value) {
  return value.is_object() ? value.value("query", SXValue()) : SXValue();
}

std::pair<Name, Name> toQuery(const SXValue& query) {
  if (!query.is_object()) return {};
  return {toName(query.value("group", SXValue())), toName(query.value("subgroup", SXValue()))};
}

// The fields of one channel entry; an entry that is not an object has none.
Name field(const SXValue& entry, const char* key) {
  return entry.is_object() ? toName(entry.value(key, SXValue())) : std::nullopt;
}

int64_t valueOf(const SXValue& sample) {
  auto value = sample.is_object() ? sample.find("value") : sample.end();
  return value != sample.end() && value->is_number_integer() ? value->get<int64_t>() : 0;
}

bool matches(const Name& wanted, const Name& actual) { return !wanted || wanted == actual; }

std::string channelKey(const Name& group, const Name& subgroup, const Name& channel) {
  return SXValue::array({toValue(group), toValue(subgroup), toValue(channel)}).dump();
}

const SXValue* channelsOf(const SXValue& value) {
  if (!value.is_object()) return nullptr;
  auto channels = value.find("channels");
  return channels != value.end() && channels->is_object() ? &*channels : nullptr;
}

}  // namespace

void FakeKestrel::setValue(const Name& group, const Name& subgroup, const Name& channel,
                           int64_t value) {
  SXMutexLock lock(mutex_);
  groups_.insert({group, subgroup});
  values_[{group, subgroup, channel}] = value;
}

void FakeKestrel::removeChannel(const Name& group, const Name& subgroup, const Name& channel) {
  SXMutexLock lock(mutex_);
  values_.erase({group, subgroup, channel});
}

void FakeKestrel::failChannelQuery(const Name& group, const Name& subgroup,
                                   std::optional<int64_t> code, bool returnChannels) {
  SXMutexLock lock(mutex_);
  queryFaults_[{group, subgroup}] = QueryFault{code, returnChannels};
}

void FakeKestrel::failSampling(const Name& group, const Name& subgroup,
                               std::optional<int64_t> code) {
  SXMutexLock lock(mutex_);
  samplingFaults_[{group, subgroup}] = code;
}

void FakeKestrel::restoreSampling(const Name& group, const Name& subgroup) {
  SXMutexLock lock(mutex_);
  samplingFaults_.erase({group, subgroup});
}

void FakeKestrel::failDelta(const Name& group, const Name& subgroup, int64_t code) {
  SXMutexLock lock(mutex_);
  deltaFaults_[{group, subgroup}] = code;
}

void FakeKestrel::setSubscriptionReturnsNull(bool on) {
  SXMutexLock lock(mutex_);
  nullSubscriptions_ = on;
}

int FakeKestrel::deltaCalls() const {
  SXMutexLock lock(mutex_);
  return deltaCalls_;
}

std::optional<SXValue> FakeKestrel::copyChannelsInGroup(const Name& group, const Name& subgroup,
                                                        int /*options*/,
                                                        std::optional<KestrelError>& error) {
  SXMutexLock lock(mutex_);
  auto fault = queryFaults_.find({group, subgroup});
  if (fault != queryFaults_.end()) {
    if (fault->second.code) error = KestrelError{*fault->second.code};
    if (!fault->second.returnChannels) return std::nullopt;
  }
  bool found = false;
  for (const auto& [g, s] : groups_) found = found || (matches(group, g) && matches(subgroup, s));
  if (!found) return std::nullopt;
  SXValue channels = SXValue::object();
  for (const auto& [id, value] : values_) {
    const auto& [g, s, n] = id;
    if (!matches(group, g) || !matches(subgroup, s)) continue;
    channels[channelKey(g, s, n)] = {
        {"group", toValue(g)}, {"subgroup", toValue(s)}, {"name", toValue(n)}};
  }
  return SXValue{{"query", queryValue(group, subgroup)}, {"channels", std::move(channels)}};
}

int64_t FakeKestrel::getChannelCount(const SXValue& channels) {
  const SXValue* list = channelsOf(channels);
  return list ? static_cast<int64_t>(list->size()) : 0;
}

std::shared_ptr<KestrelSubscription> FakeKestrel::createSubscription(const SXValue& channels,
                                                                     SXValue& subscribedChannels) {
  subscribedChannels = channels;
  SXMutexLock lock(mutex_);
  if (nullSubscriptions_ || !channels.is_object()) return nullptr;
  return std::make_shared<FakeSubscription>(queryIn(channels));
}

std::optional<SXValue> FakeKestrel::createSamples(const KestrelSubscription* subscription,
                                                  const SXValue& subscribedChannels,
                                                  std::optional<KestrelError>& error) {
  SXMutexLock lock(mutex_);
  auto* fake = dynamic_cast<const FakeSubscription*>(subscription);
  const SXValue* channels = channelsOf(subscribedChannels);
  if (!fake || !channels) {
    error = KestrelError{kFakeKestrelBadArgument};
    return std::nullopt;
  }
  auto fault = samplingFaults_.find(toQuery(fake->query));
  if (fault != samplingFaults_.end()) {
    if (fault->second) error = KestrelError{*fault->second};
    return std::nullopt;
  }
  SXValue samples = SXValue::object();
  for (const auto& [key, channel] : channels->items()) {
    auto id =
        ChannelId{field(channel, "group"), field(channel, "subgroup"), field(channel, "name")};
    auto value = values_.find(id);
    if (value == values_.end()) continue;  // removed since the subscription
    samples[key] = {{"name", toValue(std::get<2>(id))}, {"value", value->second}};
  }
  return SXValue{{"query", fake->query}, {"channels", std::move(samples)}};
}

std::optional<SXValue> FakeKestrel::createSamplesDelta(const SXValue* earlier, const SXValue& later,
                                                       std::optional<KestrelError>& error) {
  SXMutexLock lock(mutex_);
  ++deltaCalls_;
  const SXValue* before = earlier ? channelsOf(*earlier) : nullptr;
  const SXValue* after = channelsOf(later);
  if (!before || !after) {
    error = KestrelError{kFakeKestrelBadArgument};
    return std::nullopt;
  }
  auto fault = deltaFaults_.find(toQuery(queryIn(later)));
  if (fault != deltaFaults_.end()) {
    error = KestrelError{fault->second};
    return std::nullopt;
  }
  SXValue delta = SXValue::object();
  for (const auto& [key, sample] : after->items()) {
    auto old = before->find(key);
    if (old == before->end()) continue;
    delta[key] = {{"name", toValue(field(sample, "name"))},
                  {"value", valueOf(sample) - valueOf(*old)}};
  }
  return SXValue{{"query", queryIn(later)}, {"channels", std::move(delta)}};
}

void FakeKestrel::iterate(const SXValue& samples,
                          const std::function<int(const KestrelChannelSample&)>& callback) {
  const SXValue* channels = channelsOf(samples);
  if (!channels) return;
  for (const auto& sample : *channels) {
    KestrelChannelSample channel{field(sample, "name"), valueOf(sample)};
    if (callback(channel) != 0) return;
  }
}
