#include "fakes/FakeKestrel.h"

#include <stdlib.h>

#include <filesystem>
#include <fstream>

#include "platform/DiscardLog.h"

namespace {

using Name = FakeKestrel::Name;

class FakeSubscription final : public KestrelSubscription {
 public:
  FakeSubscription(SXValue query, std::shared_ptr<KestrelSubscription> real)
      : query(std::move(query)), real(std::move(real)) {}
  const SXValue query;
  const std::shared_ptr<KestrelSubscription> real;
};

SXValue toValue(const Name& name) { return name ? SXValue(*name) : SXValue(); }

Name toName(const SXValue& value) {
  return value.is_string() ? Name(value.get<std::string>()) : std::nullopt;
}

// The query a value handed out descends from, and the library's own value in it.
SXValue queryIn(const SXValue& value) {
  return value.is_object() ? value.value("query", SXValue()) : SXValue();
}
SXValue of(const SXValue& value) {
  return value.is_object() && value.contains("of") ? value["of"] : value;
}
SXValue wrap(const SXValue& query, SXValue real) {
  return {{"query", query}, {"of", std::move(real)}};
}

std::pair<Name, Name> toQuery(const SXValue& query) {
  if (!query.is_object()) return {};
  return {toName(query.value("group", SXValue())), toName(query.value("subgroup", SXValue()))};
}

std::string temporaryTree() {
  std::string pattern = (std::filesystem::temp_directory_path() / "sxr-kestrel-XXXXXX").string();
  return ::mkdtemp(pattern.data()) ? pattern : std::string("/nonexistent");
}

}  // namespace

FakeKestrel::FakeKestrel()
    : root_(temporaryTree()), real_(root_, std::make_shared<SXDiscardLog>()) {}

FakeKestrel::~FakeKestrel() {
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

std::string FakeKestrel::counterPath(const Name& group, const Name& subgroup,
                                     const Name& channel) const {
  return root_ + "/" + group.value_or("-") + "/" + subgroup.value_or("-") + "/" +
         channel.value_or("-");
}

void FakeKestrel::setValue(const Name& group, const Name& subgroup, const Name& channel,
                           int64_t value) {
  std::string path = counterPath(group, subgroup, channel);
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path) << value;
}

void FakeKestrel::removeChannel(const Name& group, const Name& subgroup, const Name& channel) {
  std::filesystem::remove(counterPath(group, subgroup, channel));
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
                                                        int options,
                                                        std::optional<KestrelError>& error) {
  {
    SXMutexLock lock(mutex_);
    auto fault = queryFaults_.find({group, subgroup});
    if (fault != queryFaults_.end()) {
      if (fault->second.code) error = KestrelError{*fault->second.code};
      if (!fault->second.returnChannels) return std::nullopt;
    }
  }
  std::optional<KestrelError> ignored;
  auto channels = real_.copyChannelsInGroup(group, subgroup, options, error ? ignored : error);
  if (!channels) return std::nullopt;
  return wrap({{"group", toValue(group)}, {"subgroup", toValue(subgroup)}}, std::move(*channels));
}

int64_t FakeKestrel::getChannelCount(const SXValue& channels) {
  return real_.getChannelCount(of(channels));
}

std::shared_ptr<KestrelSubscription> FakeKestrel::createSubscription(const SXValue& channels,
                                                                     SXValue& subscribedChannels) {
  SXValue subscribed;
  auto real = real_.createSubscription(of(channels), subscribed);
  subscribedChannels = wrap(queryIn(channels), std::move(subscribed));
  SXMutexLock lock(mutex_);
  if (nullSubscriptions_ || !real) return nullptr;
  return std::make_shared<FakeSubscription>(queryIn(channels), std::move(real));
}

std::optional<SXValue> FakeKestrel::createSamples(const KestrelSubscription* subscription,
                                                  const SXValue& subscribedChannels,
                                                  std::optional<KestrelError>& error) {
  auto* fake = dynamic_cast<const FakeSubscription*>(subscription);
  if (!fake) return real_.createSamples(nullptr, of(subscribedChannels), error);
  {
    SXMutexLock lock(mutex_);
    auto fault = samplingFaults_.find(toQuery(fake->query));
    if (fault != samplingFaults_.end()) {
      if (fault->second) error = KestrelError{*fault->second};
      return std::nullopt;
    }
  }
  auto samples = real_.createSamples(fake->real.get(), of(subscribedChannels), error);
  if (!samples) return std::nullopt;
  return wrap(fake->query, std::move(*samples));
}

std::optional<SXValue> FakeKestrel::createSamplesDelta(const SXValue* earlier, const SXValue& later,
                                                       std::optional<KestrelError>& error) {
  {
    SXMutexLock lock(mutex_);
    ++deltaCalls_;
    auto fault = deltaFaults_.find(toQuery(queryIn(later)));
    if (fault != deltaFaults_.end()) {
      error = KestrelError{fault->second};
      return std::nullopt;
    }
  }
  SXValue before = earlier ? of(*earlier) : SXValue();
  auto delta = real_.createSamplesDelta(earlier ? &before : nullptr, of(later), error);
  if (!delta) return std::nullopt;
  return wrap(queryIn(later), std::move(*delta));
}

void FakeKestrel::iterate(const SXValue& samples,
                          const std::function<int(const KestrelChannelSample&)>& callback) {
  real_.iterate(of(samples), callback);
}
