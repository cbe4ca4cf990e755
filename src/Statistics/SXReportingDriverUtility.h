// Driver statistics: subscriptions to the counters of four audio driver groups, snapshots of
// them when a session starts and the counters that rose when it stops.
//
// The utility subscribes once, when it is made, and never changes its subscriptions after.
// getSnapShot and getDriverStatisticsRelativeToSnapShot run on the server queue, one call at a
// time; the accessors may be called from any thread.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "SXReportingEnvironment.h"
#include "common/SXThreadSafety.h"
#include "platform/Kestrel.h"

// One driver group to subscribe to; an absent name matches any.
class SXReportingDriver {
 public:
  static std::shared_ptr<SXReportingDriver> driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);

  std::optional<std::string> groupName() const;
  void setGroupName(std::optional<std::string> groupName);
  std::optional<std::string> subGroupName() const;
  void setSubGroupName(std::optional<std::string> subGroupName);

  // "<group>-<subgroup>", "(null)" for an absent name: names the driver in log lines and keys
  // its samples in a snapshot.
  std::string description() const;

 private:
  mutable SXMutex mutex_;
  std::optional<std::string> groupName_ SX_GUARDED_BY(mutex_);
  std::optional<std::string> subGroupName_ SX_GUARDED_BY(mutex_);
};

// One live subscription of the driver-statistics library.
class SXReportingIOChannelSubscription {
 public:
  // initWithDriver: no handle and no subscribed channels yet.
  explicit SXReportingIOChannelSubscription(std::shared_ptr<SXReportingDriver> driver);

  // The library's handle, held for the life of the process; may be nullptr.
  std::shared_ptr<KestrelSubscription> subscription() const;
  void setSubscription(std::shared_ptr<KestrelSubscription> subscription);
  // The library's description of the channels covered; handed back at every sampling.
  std::optional<SXValue> subscribedChannels() const;
  void setSubscribedChannels(std::optional<SXValue> subscribedChannels);
  std::shared_ptr<SXReportingDriver> driver() const;
  void setDriver(std::shared_ptr<SXReportingDriver> driver);

 private:
  mutable SXMutex mutex_;
  std::shared_ptr<KestrelSubscription> subscription_ SX_GUARDED_BY(mutex_);
  std::optional<SXValue> subscribedChannels_ SX_GUARDED_BY(mutex_);
  std::shared_ptr<SXReportingDriver> driver_ SX_GUARDED_BY(mutex_);
};

class SXReportingDriverUtility {
 public:
  using Subscriptions = std::vector<std::shared_ptr<SXReportingIOChannelSubscription>>;

  // init: registers the driver log scope "sxrd" and subscribes to every driver group that has
  // channels. Never fails; a group without channels is left out.
  explicit SXReportingDriverUtility(SXReportingEnvironment& environment);
  SXReportingDriverUtility(const SXReportingDriverUtility&) = delete;
  SXReportingDriverUtility& operator=(const SXReportingDriverUtility&) = delete;

  // One entry per subscribed driver, in subscription order.
  Subscriptions ioChannelSubscriptions() const;
  void setIoChannelSubscriptions(Subscriptions subscriptions);

  // The current samples of every subscription that could be sampled, keyed by the driver's
  // description. Never null; an empty object when nothing could be sampled.
  SXValue getSnapShot();

  // The counters that rose since `snapshot`, as counter name -> change (an int64 of at least
  // 1); without a snapshot, the counters' absolute values. Nothing when no counter qualifies.
  std::optional<SXValue> getDriverStatisticsRelativeToSnapShot(
      const std::optional<SXValue>& snapshot);

 private:
  void subscribe(Kestrel& kestrel, const std::shared_ptr<SXReportingDriver>& driver,
                 Subscriptions& subscriptions);
  // Current samples of one subscription; nothing when sampling failed (logged under
  // `function`).
  std::optional<SXValue> sample(Kestrel& kestrel,
                                const SXReportingIOChannelSubscription& subscription,
                                const char* function);
  // The samples whose counters are reported: the change since `snapshot`'s entry, or the
  // current samples when there is no snapshot or the change cannot be computed.
  std::optional<SXValue> samplesToReport(Kestrel& kestrel, const SXReportingDriver& driver,
                                         const std::optional<SXValue>& snapshot,
                                         const SXValue& current);

  SXReportingEnvironment& environment_;
  mutable SXMutex mutex_;
  Subscriptions subscriptions_ SX_GUARDED_BY(mutex_);
};
