#include "SXReportingDriverUtility.h"

namespace {

constexpr const char* kInit = "-[SXReportingDriverUtility init]";
constexpr const char* kGetSnapShot = "-[SXReportingDriverUtility getSnapShot]";
constexpr const char* kGetStatistics =
    "-[SXReportingDriverUtility getDriverStatisticsRelativeToSnapShot:]";

// Current samples of `subscription`. A subscription without a handle is still handed to the
// library, which answers it with an error.
std::optional<SXValue> createSamples(Kestrel& kestrel,
                                     const SXReportingIOChannelSubscription& subscription,
                                     std::optional<KestrelError>& error) {
  std::shared_ptr<KestrelSubscription> handle = subscription.subscription();
  return kestrel.createSamples(
      handle.get(), subscription.subscribedChannels().value_or(SXValue::object()), error);
}

// Adds every counter of `samples` that is at least 1 to `result`, named
// "<group>_<subgroup>_<channel>" with the absent parts (and their "_") left out.
void addCounters(Kestrel& kestrel, const SXReportingDriver& driver, const SXValue& samples,
                 SXValue& result) {
  std::string prefix;
  if (auto group = driver.groupName()) prefix += *group + "_";
  if (auto subgroup = driver.subGroupName()) prefix += *subgroup + "_";
  kestrel.iterate(samples, [&](const KestrelChannelSample& sample) {
    if (sample.value < 1) return 0;
    result[prefix + sample.channelName.value_or("")] = sample.value;
    return 0;
  });
}

}  // namespace

// Every line of the driver utility goes through the driver scope (the default log before it
// is registered).
#define SXR_DRIVER_LOG(function, level, ...) \
  SXLOG_IN((function), environment_.log(), environment_.driverLogScope(), (level), __VA_ARGS__)

std::shared_ptr<SXReportingDriver> SXReportingDriver::driverWithGroupName(
    std::optional<std::string> groupName, std::optional<std::string> subGroupName) {
  auto driver = std::make_shared<SXReportingDriver>();
  driver->setGroupName(std::move(groupName));
  driver->setSubGroupName(std::move(subGroupName));
  return driver;
}

std::optional<std::string> SXReportingDriver::groupName() const {
  SXMutexLock lock(mutex_);
  return groupName_;
}

void SXReportingDriver::setGroupName(std::optional<std::string> groupName) {
  SXMutexLock lock(mutex_);
  groupName_ = std::move(groupName);
}

std::optional<std::string> SXReportingDriver::subGroupName() const {
  SXMutexLock lock(mutex_);
  return subGroupName_;
}

void SXReportingDriver::setSubGroupName(std::optional<std::string> subGroupName) {
  SXMutexLock lock(mutex_);
  subGroupName_ = std::move(subGroupName);
}

std::string SXReportingDriver::description() const {
  return SXFormat("%@-%@", groupName(), subGroupName());
}

SXReportingIOChannelSubscription::SXReportingIOChannelSubscription(
    std::shared_ptr<SXReportingDriver> driver)
    : driver_(std::move(driver)) {}

std::shared_ptr<KestrelSubscription> SXReportingIOChannelSubscription::subscription() const {
  SXMutexLock lock(mutex_);
  return subscription_;
}

void SXReportingIOChannelSubscription::setSubscription(
    std::shared_ptr<KestrelSubscription> subscription) {
  SXMutexLock lock(mutex_);
  subscription_ = std::move(subscription);
}

std::optional<SXValue> SXReportingIOChannelSubscription::subscribedChannels() const {
  SXMutexLock lock(mutex_);
  return subscribedChannels_;
}

void SXReportingIOChannelSubscription::setSubscribedChannels(
    std::optional<SXValue> subscribedChannels) {
  SXMutexLock lock(mutex_);
  subscribedChannels_ = std::move(subscribedChannels);
}

std::shared_ptr<SXReportingDriver> SXReportingIOChannelSubscription::driver() const {
  SXMutexLock lock(mutex_);
  return driver_;
}

void SXReportingIOChannelSubscription::setDriver(std::shared_ptr<SXReportingDriver> driver) {
  SXMutexLock lock(mutex_);
  driver_ = std::move(driver);
}

SXReportingDriverUtility::SXReportingDriverUtility(SXReportingEnvironment& environment)
    : environment_(environment) {
  environment_.setDriverLogScope(
      environment_.log().registerScope(SXReportingLogScope("sxrd", "reporting_driver_verbose")));
  SXR_DRIVER_LOG(kInit, SXLogLevel::kInfo, "creating kestrelstats driver utility");
  const std::shared_ptr<SXReportingDriver> drivers[] = {
      SXReportingDriver::driverWithGroupName("VendraAE2MCA", std::nullopt),
      SXReportingDriver::driverWithGroupName("Speaker", std::nullopt),
      SXReportingDriver::driverWithGroupName(std::nullopt, "MCA"),
      SXReportingDriver::driverWithGroupName("Haptics", "Stats"),
  };
  Subscriptions subscriptions;
  // Without a driver-statistics library there is nothing to subscribe to.
  if (Kestrel* kestrel = environment_.platform().kestrel.get()) {
    for (const auto& driver : drivers) subscribe(*kestrel, driver, subscriptions);
  }
  setIoChannelSubscriptions(std::move(subscriptions));
}

void SXReportingDriverUtility::subscribe(Kestrel& kestrel,
                                         const std::shared_ptr<SXReportingDriver>& driver,
                                         Subscriptions& subscriptions) {
  const std::optional<std::string> group = driver->groupName();
  const std::optional<std::string> subgroup = driver->subGroupName();
  std::optional<KestrelError> error;
  std::optional<SXValue> channels = kestrel.copyChannelsInGroup(group, subgroup, 0, error);
  if (error) {
    SXR_DRIVER_LOG(kInit, SXLogLevel::kError, "error %li getting channels for driver %@-%@",
                   error->code, group, subgroup);
  }
  if (!channels) return;
  if (kestrel.getChannelCount(*channels) < 1) {
    SXR_DRIVER_LOG(kInit, SXLogLevel::kInfo, "couldn't find any channels for driver group %@-%@",
                   group, subgroup);
  } else {
    auto subscription = std::make_shared<SXReportingIOChannelSubscription>(driver);
    SXValue subscribed;
    // A subscription without a handle is kept: sampling it fails and is logged then.
    subscription->setSubscription(kestrel.createSubscription(*channels, subscribed));
    subscription->setSubscribedChannels(subscribed.is_object() ? std::move(subscribed)
                                                               : SXValue::object());
    subscriptions.push_back(std::move(subscription));
  }
  SXR_DRIVER_LOG(kInit, SXLogLevel::kDefault, "subscribed to group group %@-%@", group, subgroup);
}

SXReportingDriverUtility::Subscriptions SXReportingDriverUtility::ioChannelSubscriptions() const {
  SXMutexLock lock(mutex_);
  return subscriptions_;
}

void SXReportingDriverUtility::setIoChannelSubscriptions(Subscriptions subscriptions) {
  SXMutexLock lock(mutex_);
  subscriptions_ = std::move(subscriptions);
}

SXValue SXReportingDriverUtility::getSnapShot() {
  SXValue snapshot = SXValue::object();
  Kestrel* kestrel = environment_.platform().kestrel.get();
  if (!kestrel) return snapshot;
  for (const auto& subscription : ioChannelSubscriptions()) {
    std::shared_ptr<SXReportingDriver> driver = subscription->driver();
    if (!driver) continue;
    const std::string description = driver->description();
    SXR_DRIVER_LOG(kGetSnapShot, SXLogLevel::kInfo, "sampling driver %@", description);
    std::optional<KestrelError> error;
    std::optional<SXValue> samples = createSamples(*kestrel, *subscription, error);
    if (error) {
      SXR_DRIVER_LOG(kGetSnapShot, SXLogLevel::kError, "KestrelCreateSamples error %li",
                     error->code);
      continue;
    }
    if (samples) snapshot[description] = std::move(*samples);
  }
  return snapshot;
}

std::optional<SXValue> SXReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const std::optional<SXValue>& snapshot) {
  Kestrel* kestrel = environment_.platform().kestrel.get();
  if (!kestrel) return std::nullopt;
  SXValue result = SXValue::object();
  for (const auto& subscription : ioChannelSubscriptions()) {
    std::shared_ptr<SXReportingDriver> driver = subscription->driver();
    if (!driver) continue;
    SXR_DRIVER_LOG(kGetStatistics, SXLogLevel::kInfo, "getting latest samples");
    std::optional<KestrelError> error;
    std::optional<SXValue> current = createSamples(*kestrel, *subscription, error);
    SXR_DRIVER_LOG(kGetStatistics, SXLogLevel::kInfo, "done getting latest samples");
    if (error) {
      SXR_DRIVER_LOG(kGetStatistics, SXLogLevel::kError, "KestrelCreateSamples error %li",
                     error->code);
      continue;
    }
    if (!current) continue;
    std::optional<SXValue> report = samplesToReport(*kestrel, *driver, snapshot, *current);
    if (report) addCounters(*kestrel, *driver, *report, result);
  }
  if (result.empty()) return std::nullopt;
  return result;
}

std::optional<SXValue> SXReportingDriverUtility::samplesToReport(
    Kestrel& kestrel, const SXReportingDriver& driver, const std::optional<SXValue>& snapshot,
    const SXValue& current) {
  if (!snapshot) return current;
  // A snapshot without this driver's entry is handed on as missing; the library answers that
  // with an error, and the absolute values are reported.
  const SXValue* earlier = nullptr;
  if (snapshot->is_object()) {
    auto entry = snapshot->find(driver.description());
    if (entry != snapshot->end()) earlier = &*entry;
  }
  std::optional<KestrelError> error;
  std::optional<SXValue> delta = kestrel.createSamplesDelta(earlier, current, error);
  if (error) {
    SXR_DRIVER_LOG(kGetStatistics, SXLogLevel::kError, "KestrelCreateSamplesDelta error %li",
                   error->code);
    return current;
  }
  return delta;
}
