// The production driver-statistics library on a temporary counter tree, with faults a test
// switches on. A test sets and removes counters (written as the tree's files). Faults are keyed
// by the query a caller makes: the group and subgroup exactly as passed to copyChannelsInGroup
// (none meaning "any"); so every channel dictionary, subscription and samples value handed out
// remembers the query it descends from, as {"query": .., "of": <the library's own value>}.
// All methods may be called from any thread.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "common/SXThreadSafety.h"
#include "platform/FileKestrel.h"

class FakeKestrel final : public Kestrel {
 public:
  using Name = std::optional<std::string>;

  FakeKestrel();
  ~FakeKestrel() override;  // removes the tree

  // Writes the counter (making its group) with `value`.
  void setValue(const Name& group, const Name& subgroup, const Name& channel, int64_t value);
  // Removes the counter; its group stays.
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
  struct QueryFault {
    std::optional<int64_t> code;
    bool returnChannels = false;
  };
  std::string counterPath(const Name& group, const Name& subgroup, const Name& channel) const;

  const std::string root_;
  SXFileKestrel real_;
  mutable SXMutex mutex_;
  std::map<Query, QueryFault> queryFaults_ SX_GUARDED_BY(mutex_);
  std::map<Query, std::optional<int64_t>> samplingFaults_ SX_GUARDED_BY(mutex_);
  std::map<Query, int64_t> deltaFaults_ SX_GUARDED_BY(mutex_);
  bool nullSubscriptions_ SX_GUARDED_BY(mutex_) = false;
  int deltaCalls_ SX_GUARDED_BY(mutex_) = 0;
};
