// The driver-statistics library (Kestrel): counters that audio drivers publish as channels,
// grouped by a group name and a subgroup name; subscriptions to them; samples, the change
// between two samples, and iteration over the channels of a sample.
//
// Channel dictionaries, subscribed-channel dictionaries and samples are opaque values: callers
// keep them and hand them back to the library, and never look inside. Each is a fresh value
// that the caller owns. Errors carry a signed integer code; the adapters use errno values.
//
// All methods may be called from any thread. None throws: on failure a method sets `error`
// and returns nothing (or nullptr), as each method's comment says.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "sxreporting/types.h"

struct KestrelError {
  int64_t code = 0;
};

// One channel's sample, as iterate hands it to its callback.
struct KestrelChannelSample {
  std::optional<std::string> channelName;  // none: the channel has no name
  int64_t value = 0;
};

// A subscription handle. Owned by whoever holds it; never inspected by callers.
class KestrelSubscription {
 public:
  virtual ~KestrelSubscription() = default;
};

class Kestrel {
 public:
  virtual ~Kestrel() = default;

  // Every channel in `group` / `subgroup`; none matches any. `options` is reserved (pass 0).
  // Returns nothing when no such group exists, and an empty dictionary when the group exists
  // but holds no channels. On failure sets `error`; channels found before the failure may
  // still come back.
  virtual std::optional<SXValue> copyChannelsInGroup(const std::optional<std::string>& group,
                                                     const std::optional<std::string>& subgroup,
                                                     int options,
                                                     std::optional<KestrelError>& error) = 0;

  // Number of channels `channels` describes; 0 for a value that describes none.
  virtual int64_t getChannelCount(const SXValue& channels) = 0;

  // Subscribes to `channels`; sets `subscribedChannels` to the channels actually covered.
  // Returns nullptr when no subscription could be made; sampling nullptr fails harmlessly.
  virtual std::shared_ptr<KestrelSubscription> createSubscription(const SXValue& channels,
                                                                  SXValue& subscribedChannels) = 0;

  // The current samples of every subscribed channel that still exists. On failure (nullptr or
  // a foreign subscription, a malformed dictionary) sets `error` and returns nothing.
  virtual std::optional<SXValue> createSamples(const KestrelSubscription* subscription,
                                               const SXValue& subscribedChannels,
                                               std::optional<KestrelError>& error) = 0;

  // Per channel present in both, later minus earlier. When `earlier` is nullptr or either
  // value is not a sample, sets `error` and returns nothing.
  virtual std::optional<SXValue> createSamplesDelta(const SXValue* earlier, const SXValue& later,
                                                    std::optional<KestrelError>& error) = 0;

  // Calls `callback` for each channel sample of `samples`, stopping when it returns non-zero.
  // A value that is not a sample has no channels.
  virtual void iterate(const SXValue& samples,
                       const std::function<int(const KestrelChannelSample&)>& callback) = 0;
};
