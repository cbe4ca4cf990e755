// The driver-statistics library (Kestrel): channels published by audio drivers, grouped by
// group and subgroup; subscriptions to them; samples, deltas between samples, iteration.
//
// Channel dictionaries, subscribed-channel dictionaries and samples are opaque values that
// callers only hand back to the library. Errors carry a signed integer code.
// All methods may be called from any thread.
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

// One channel's sample, as KestrelIterate hands it to its callback.
struct KestrelChannelSample {
  std::optional<std::string> channelName;
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

  // Every channel in `group` / `subgroup` (nothing matches any). Returns nothing when there is
  // nothing to describe; sets `error` on failure (a result may still come back).
  virtual std::optional<SXValue> copyChannelsInGroup(const std::optional<std::string>& group,
                                                     const std::optional<std::string>& subgroup,
                                                     int options,
                                                     std::optional<KestrelError>& error) = 0;

  virtual int64_t getChannelCount(const SXValue& channels) = 0;

  // Subscribes to `channels`; fills `subscribedChannels` with the channels actually covered.
  // May return nullptr.
  virtual std::shared_ptr<KestrelSubscription> createSubscription(const SXValue& channels,
                                                                  SXValue& subscribedChannels) = 0;

  // Current samples of every subscribed channel. Returns nothing on failure and sets `error`.
  virtual std::optional<SXValue> createSamples(const KestrelSubscription* subscription,
                                               const SXValue& subscribedChannels,
                                               std::optional<KestrelError>& error) = 0;

  // Per channel, later minus earlier. `earlier` may be absent; the library then sets `error`.
  virtual std::optional<SXValue> createSamplesDelta(const SXValue* earlier, const SXValue& later,
                                                    std::optional<KestrelError>& error) = 0;

  // Calls `callback` for each channel sample; stops when the callback returns non-zero.
  virtual void iterate(const SXValue& samples,
                       const std::function<int(const KestrelChannelSample&)>& callback) = 0;
};
