// Production driver-statistics library: counters that drivers publish as files.
//
// Layout: `<root>/<group>/<subgroup>/<channel>`, each file holding one decimal integer
// (surrounding white space allowed). A directory or file named "-" stands for an absent group,
// subgroup or channel name; names starting with "." are ignored. A missing root means that no
// driver publishes anything. The root may be a symlink; nothing below it is reached through one:
// symlinks are not listed, and a channel reached through one is not read.
//
// Values it hands out:
//   channels / subscribed channels  {"<group>/<subgroup>/<channel>":
//                                      {"group": .., "subgroup": .., "name": ..}}
//   samples                         the same entries, each with "value": <int64>
// where an absent name is null. Keys are the paths below the root.
//
// Every call reads the files anew; nothing is cached, so any thread may call any method.
// Error codes are errno values: EINVAL for bad arguments, otherwise the failing call's errno.
// A counter file that cannot be read or does not hold an integer is left out of its samples,
// with an error line on the log facility given at construction; the other channels still
// sample.
#pragma once

#include <array>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Kestrel.h"
#include "platform/Log.h"

class SXFileKestrel final : public Kestrel {
 public:
  // `log` (not null) receives the error lines of unreadable counters.
  SXFileKestrel(std::string root, std::shared_ptr<SXLogFacility> log);

  std::optional<SXValue> copyChannelsInGroup(const std::optional<std::string>& group,
                                             const std::optional<std::string>& subgroup,
                                             int options,
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
  // Reads the counter file `key` (split into `parts`); nothing when it is missing or below a
  // symlinked directory (quiet), or unreadable, a symlink or not an integer (logged).
  std::optional<int64_t> readCounter(const std::string& key,
                                     const std::array<std::string_view, 3>& parts) const;

  const std::string root_;
  const std::shared_ptr<SXLogFacility> log_;
};
