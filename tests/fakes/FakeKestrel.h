// An in-memory driver-statistics library. A test adds groups and channels, sets and changes
// their values, and switches faults on. Faults are keyed by the query a caller makes: the
// group and subgroup exactly as passed to copyChannelsInGroup (none meaning "any"). Every
// subscription, sample and delta remembers the query it descends from.
//
// Values it hands out:
//   channels    {"query": {"group": .., "subgroup": ..}, "channels": {<id>: {...}}}
//   samples     the same, each channel with "name" and "value"
// Failures set error code kFakeKestrelBadArgument unless a fault names its own code.
// All methods may be called from any thread.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <tuple>

#include "common/SXThreadSafety.h"
#include "platform/Kestrel.h"

inline constexpr int64_t kFakeKestrelBadArgument = 22;

class FakeKestrel final : public Kestrel {
 public:
  using Name = std::optional<std::string>;

  // Adds the channel (and its group) with `value`, or sets the value of an existing one.
  void setValue(const Name& group, const Name& subgroup, const Name& channel, int64_t value);
  void removeChannel(const Name& group, const Name& subgroup, const Name& channel);

  // The channel query for (group, subgroup) sets an error with `code` (none: no error) and
  // returns its channels only when `returnChannels`.
  void failChannelQuery(const Name& group, const Name& subgroup, std::optional<int64_t> code,
                        bool returnChannels);
  // Sampling of subscriptions made from the query returns nothing, setting an error with
  // `code` (none: silently).
  void failSampling(const Name& group, const Name& subgroup, std::optional<int64_t> code);
  void restoreSampling(const Name& group, const Name& subgroup);
  // Deltas of samples from the query set an error with `code` and return nothing.
  void failDelta(const Name& group, const Name& subgroup, int64_t code);
  // createSubscription returns nullptr (the subscribed channels are still filled in).
  void setSubscriptionReturnsNull(bool on);

  int deltaCalls() const;

  std::optional<SXValue> copyChannelsInGroup(const Name& group, const Name& subgroup, int options,
                                             std::optional<KestrelError>& error) override;
  int64_t getChannelCount(const SXValue& channels) override;
  std::shared_ptr<KestrelSubscription> createSubscription(const SXValue& channels,
                                                          SXValue& subscribedChannels) override;
  std::optional<SXValue> createSamples(const KestrelSubscription* subscription,
                                       const SXValue& subscribedChannels,
                                       std::optional<KestrelError>& error) override;
  std::optional<SXValue> createSamplesDelta(const SXValue* earlier, const SXValue& later,
                                            std::optional<KestrelError>& error) override;
  void iterate(const SXValue& samples,
               const std::function<int(const KestrelChannelSample&)>& callback) override;

 private:
  using Query = std::pair<Name, Name>;
  using ChannelId = std::tuple<Name, Name, Name>;
  struct QueryFault {
    std::optional<int64_t> code;
    bool returnChannels = false;
  };

  mutable SXMutex mutex_;
  std::set<Query> groups_ SX_GUARDED_BY(mutex_);
  std::map<ChannelId, int64_t> values_ SX_GUARDED_BY(mutex_);
  std::map<Query, QueryFault> queryFaults_ SX_GUARDED_BY(mutex_);
  std::map<Query, std::optional<int64_t>> samplingFaults_ SX_GUARDED_BY(mutex_);
  std::map<Query, int64_t> deltaFaults_ SX_GUARDED_BY(mutex_);
  bool nullSubscriptions_ SX_GUARDED_BY(mutex_) = false;
  int deltaCalls_ SX_GUARDED_BY(mutex_) = 0;
};
