// The production driver-statistics library on a temporary counter tree, with faults a test
// switches on. A test sets and removes counters (written as the tree's files). A fault is keyed
// by a query, group and subgroup as passed to copyChannelsInGroup (none meaning "any"): a channel
// query fails when it is that query; sampling and deltas fail for values whose every channel
// lies in that group and subgroup. All methods may be called from any thread.
#pragma once

#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <string>

#include "common/SXThreadSafety.h"
#include "linux/FileKestrel.h"
#include "platform/DiscardLog.h"
#include "support/SqliteTestSupport.h"

class FakeKestrel final : public Kestrel {
 public:
  using Name = std::optional<std::string>;

  FakeKestrel() : real_(root_, std::make_shared<SXDiscardLog>()) {}

  // Writes the counter (making its group) with `value`.
  void setValue(const Name& group, const Name& subgroup, const Name& channel, int64_t value) {
    std::filesystem::path path = counterPath(group, subgroup, channel);
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path) << value;
  }
  // Removes the counter; its group stays.
  void removeChannel(const Name& group, const Name& subgroup, const Name& channel) {
    std::filesystem::remove(counterPath(group, subgroup, channel));
  }
  // The channel query sets an error with `code` (none: no error) and returns its channels only
  // when `returnChannels`.
  void failChannelQuery(const Name& group, const Name& subgroup, std::optional<int64_t> code,
                        bool returnChannels) {
    SXMutexLock lock(mutex_);
    queryFaults_[{group, subgroup}] = {code, returnChannels};
  }
  // Sampling returns nothing, setting an error with `code` (none: silently).
  void failSampling(const Name& group, const Name& subgroup, std::optional<int64_t> code) {
    SXMutexLock lock(mutex_);
    samplingFaults_[{group, subgroup}] = code;
  }
  void restoreSampling(const Name& group, const Name& subgroup) {
    SXMutexLock lock(mutex_);
    samplingFaults_.erase({group, subgroup});
  }
  // Deltas set an error with `code` and return nothing.
  void failDelta(const Name& group, const Name& subgroup, int64_t code) {
    SXMutexLock lock(mutex_);
    deltaFaults_[{group, subgroup}] = code;
  }
  // createSubscription returns nullptr (the subscribed channels are still filled in).
  void setSubscriptionReturnsNull(bool on) {
    SXMutexLock lock(mutex_);
    nullSubscriptions_ = on;
  }
  int deltaCalls() const {
    SXMutexLock lock(mutex_);
    return deltaCalls_;
  }

  std::optional<SXValue> copyChannelsInGroup(const Name& group, const Name& subgroup, int options,
                                             std::optional<KestrelError>& error) override {
    {
      SXMutexLock lock(mutex_);
      auto fault = queryFaults_.find({group, subgroup});
      if (fault != queryFaults_.end()) {
        if (fault->second.first) error = KestrelError{*fault->second.first};
        if (!fault->second.second) return std::nullopt;
      }
    }
    std::optional<KestrelError> ignored;
    return real_.copyChannelsInGroup(group, subgroup, options, error ? ignored : error);
  }
  int64_t getChannelCount(const SXValue& channels) override {
    return real_.getChannelCount(channels);
  }
  std::shared_ptr<KestrelSubscription> createSubscription(const SXValue& channels,
                                                          SXValue& subscribedChannels) override {
    auto subscription = real_.createSubscription(channels, subscribedChannels);
    SXMutexLock lock(mutex_);
    return nullSubscriptions_ ? nullptr : subscription;
  }
  std::optional<SXValue> createSamples(const KestrelSubscription* subscription,
                                       const SXValue& subscribedChannels,
                                       std::optional<KestrelError>& error) override {
    {
      SXMutexLock lock(mutex_);
      for (const auto& [query, code] : samplingFaults_) {
        if (!within(query, subscribedChannels)) continue;
        if (code) error = KestrelError{*code};
        return std::nullopt;
      }
    }
    return real_.createSamples(subscription, subscribedChannels, error);
  }
  std::optional<SXValue> createSamplesDelta(const SXValue* earlier, const SXValue& later,
                                            std::optional<KestrelError>& error) override {
    {
      SXMutexLock lock(mutex_);
      ++deltaCalls_;
      for (const auto& [query, code] : deltaFaults_) {
        if (!within(query, later)) continue;
        error = KestrelError{code};
        return std::nullopt;
      }
    }
    return real_.createSamplesDelta(earlier, later, error);
  }
  void iterate(const SXValue& samples,
               const std::function<int(const KestrelChannelSample&)>& callback) override {
    real_.iterate(samples, callback);
  }

 private:
  using Query = std::pair<Name, Name>;
  std::string counterPath(const Name& group, const Name& subgroup, const Name& channel) const {
    return root_ + "/" + group.value_or("-") + "/" + subgroup.value_or("-") + "/" +
           channel.value_or("-");
  }
  // Whether every channel of `value` (channels or samples) lies in the query's group/subgroup.
  static bool within(const Query& query, const SXValue& value) {
    if (!value.is_object() || value.empty()) return false;
    for (const auto& [key, channel] : value.items()) {
      if (query.first && channel.value("group", SXValue()) != *query.first) return false;
      if (query.second && channel.value("subgroup", SXValue()) != *query.second) return false;
    }
    return true;
  }

  const SXTestTempDir tree_;  // removed with the fake
  const std::string root_ = tree_.path();
  SXFileKestrel real_;
  mutable SXMutex mutex_;
  // Per query: the error code, and whether the channels still come back.
  std::map<Query, std::pair<std::optional<int64_t>, bool>> queryFaults_ SX_GUARDED_BY(mutex_);
  std::map<Query, std::optional<int64_t>> samplingFaults_ SX_GUARDED_BY(mutex_);
  std::map<Query, int64_t> deltaFaults_ SX_GUARDED_BY(mutex_);
  bool nullSubscriptions_ SX_GUARDED_BY(mutex_) = false;
  int deltaCalls_ SX_GUARDED_BY(mutex_) = 0;
};
