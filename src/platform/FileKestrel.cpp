#include "platform/FileKestrel.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <filesystem>
#include <string_view>
#include <vector>

#include "platform/FileSystem.h"

namespace {

namespace fs = std::filesystem;

// Stands for an absent group, subgroup or channel name in the file tree.
constexpr std::string_view kAbsentName = "-";
// A counter is one int64 with some white space; anything longer is not a counter.
constexpr size_t kMaxCounterBytes = 64;

class SXFileKestrelSubscription final : public KestrelSubscription {};

// A name that may appear in the tree: not empty, no "/", not hidden ("." and ".." included).
bool isTreeName(std::string_view name) {
  return !name.empty() && name.front() != '.' && name.find('/') == std::string_view::npos;
}

// A name a caller may ask for; "-" is reserved for absent names.
bool isQueryName(const std::optional<std::string>& name) {
  return !name || (isTreeName(*name) && *name != kAbsentName);
}

SXValue nameValue(std::string_view treeName) {
  return treeName == kAbsentName ? SXValue() : SXValue(std::string(treeName));
}

SXValue channelEntry(std::string_view group, std::string_view subgroup, std::string_view name) {
  return {
      {"group", nameValue(group)}, {"subgroup", nameValue(subgroup)}, {"name", nameValue(name)}};
}

// Splits "<group>/<subgroup>/<channel>"; nothing unless it names a file inside the tree.
std::optional<std::array<std::string_view, 3>> splitKey(std::string_view key) {
  size_t first = key.find('/');
  size_t second = first == std::string_view::npos ? first : key.find('/', first + 1);
  if (second == std::string_view::npos || key.find('/', second + 1) != std::string_view::npos) {
    return std::nullopt;
  }
  std::array<std::string_view, 3> parts = {
      key.substr(0, first), key.substr(first + 1, second - first - 1), key.substr(second + 1)};
  for (auto part : parts) {
    if (!isTreeName(part)) return std::nullopt;
  }
  return parts;
}

void setError(std::optional<KestrelError>& error, int code) {
  if (!error) error = KestrelError{code};
}

enum class EntryKind { kDirectory, kFile };

// The visible entries of `dir` of one kind. Nothing when `dir` is missing (no error) or cannot
// be listed (error set).
std::optional<std::vector<std::string>> listEntries(const fs::path& dir, EntryKind kind,
                                                    std::optional<KestrelError>& error) {
  std::error_code ec;
  fs::directory_iterator it(dir, ec);
  if (ec) {
    if (ec != std::errc::no_such_file_or_directory && ec != std::errc::not_a_directory) {
      setError(error, ec.value());
    }
    return std::nullopt;
  }
  std::vector<std::string> names;
  for (; !ec && it != fs::directory_iterator(); it.increment(ec)) {
    std::string name = it->path().filename().string();
    std::error_code typeError;
    bool wanted = kind == EntryKind::kDirectory ? it->is_directory(typeError)
                                                : it->is_regular_file(typeError);
    if (wanted && !typeError && isTreeName(name)) names.push_back(std::move(name));
  }
  if (ec) setError(error, ec.value());
  return names;
}

// `wanted` alone when the caller names it, otherwise every visible directory in `parent`.
std::vector<std::string> directoriesNamed(const std::optional<std::string>& wanted,
                                          const fs::path& parent,
                                          std::optional<KestrelError>& error) {
  if (wanted) return {*wanted};
  return listEntries(parent, EntryKind::kDirectory, error).value_or(std::vector<std::string>{});
}

std::optional<int64_t> parseCounter(std::string_view text) {
  constexpr std::string_view kSpace = " \t\r\n\v\f";
  size_t first = text.find_first_not_of(kSpace);
  if (first == std::string_view::npos) return std::nullopt;
  text = text.substr(first, text.find_last_not_of(kSpace) - first + 1);
  if (text.front() == '+') text.remove_prefix(1);
  int64_t value = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (ec != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

std::optional<int64_t> sampleValue(const SXValue& entry) {
  if (!entry.is_object()) return std::nullopt;
  auto value = entry.find("value");
  if (value == entry.end() || !value->is_number_integer()) return std::nullopt;
  return value->get<int64_t>();
}

// Reads at most `buffer.size()` bytes; returns the count, or -1 with errno set.
ssize_t readUpTo(int fd, std::string& buffer) {
  size_t done = 0;
  while (done < buffer.size()) {
    ssize_t n = ::read(fd, buffer.data() + done, buffer.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return -1;
    if (n == 0) break;
    done += static_cast<size_t>(n);
  }
  return static_cast<ssize_t>(done);
}

}  // namespace

SXFileKestrel::SXFileKestrel(std::string root, std::shared_ptr<SXLogFacility> log)
    : root_(std::move(root)), log_(std::move(log)) {}

std::optional<SXValue> SXFileKestrel::copyChannelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup,
    int /*options*/, std::optional<KestrelError>& error) {
  if (!isQueryName(group) || !isQueryName(subgroup)) {
    setError(error, EINVAL);
    return std::nullopt;
  }
  const fs::path root(root_);
  // A matching subgroup directory, even an empty one, makes a (possibly empty) dictionary.
  std::optional<SXValue> channels;
  for (const auto& g : directoriesNamed(group, root, error)) {
    for (const auto& s : directoriesNamed(subgroup, root / g, error)) {
      auto files = listEntries(root / g / s, EntryKind::kFile, error);
      if (!files) continue;
      if (!channels) channels = SXValue::object();
      for (const auto& f : *files) (*channels)[g + "/" + s + "/" + f] = channelEntry(g, s, f);
    }
  }
  return channels;
}

int64_t SXFileKestrel::getChannelCount(const SXValue& channels) {
  return channels.is_object() ? static_cast<int64_t>(channels.size()) : 0;
}

std::shared_ptr<KestrelSubscription> SXFileKestrel::createSubscription(
    const SXValue& channels, SXValue& subscribedChannels) {
  subscribedChannels = SXValue::object();
  if (!channels.is_object()) return nullptr;
  for (const auto& [key, entry] : channels.items()) {
    if (auto parts = splitKey(key)) {
      subscribedChannels[key] = channelEntry((*parts)[0], (*parts)[1], (*parts)[2]);
    }
  }
  return std::make_shared<SXFileKestrelSubscription>();
}

std::optional<SXValue> SXFileKestrel::createSamples(const KestrelSubscription* subscription,
                                                    const SXValue& subscribedChannels,
                                                    std::optional<KestrelError>& error) {
  if (!dynamic_cast<const SXFileKestrelSubscription*>(subscription) ||
      !subscribedChannels.is_object()) {
    setError(error, EINVAL);
    return std::nullopt;
  }
  SXValue samples = SXValue::object();
  for (const auto& [key, entry] : subscribedChannels.items()) {
    auto parts = splitKey(key);
    if (!parts) continue;
    auto value = readCounter(key);
    if (!value) continue;
    SXValue sample = channelEntry((*parts)[0], (*parts)[1], (*parts)[2]);
    sample["value"] = *value;
    samples[key] = std::move(sample);
  }
  return samples;
}

std::optional<SXValue> SXFileKestrel::createSamplesDelta(const SXValue* earlier,
                                                         const SXValue& later,
                                                         std::optional<KestrelError>& error) {
  if (!earlier || !earlier->is_object() || !later.is_object()) {
    setError(error, EINVAL);
    return std::nullopt;
  }
  SXValue delta = SXValue::object();
  for (const auto& [key, entry] : later.items()) {
    auto before = earlier->find(key);
    if (before == earlier->end()) continue;
    auto from = sampleValue(*before);
    auto to = sampleValue(entry);
    int64_t change = 0;
    // A counter that jumped by more than int64 can hold has no meaningful change.
    if (!from || !to || __builtin_sub_overflow(*to, *from, &change)) continue;
    SXValue sample = entry;
    sample["value"] = change;
    delta[key] = std::move(sample);
  }
  return delta;
}

void SXFileKestrel::iterate(const SXValue& samples,
                            const std::function<int(const KestrelChannelSample&)>& callback) {
  if (!samples.is_object()) return;
  for (const auto& entry : samples) {
    auto value = sampleValue(entry);
    if (!value) continue;
    KestrelChannelSample sample;
    sample.value = *value;
    auto name = entry.find("name");
    if (name != entry.end() && name->is_string()) sample.channelName = name->get<std::string>();
    if (callback(sample) != 0) return;
  }
}

std::optional<int64_t> SXFileKestrel::readCounter(const std::string& key) const {
  const std::string path = root_ + "/" + key;
  // Non-blocking, so that a FIFO put where a counter belongs cannot stall sampling.
  SXScopedFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  if (fd.get() < 0) {
    // A channel that went away since the subscription is simply not sampled.
    if (errno != ENOENT && errno != ENOTDIR) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot read kestrel channel: %s",
            SXPosixError(path, errno));
    }
    return std::nullopt;
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "kestrel channel %s is not a regular file", path);
    return std::nullopt;
  }
  std::string buffer(kMaxCounterBytes + 1, '\0');
  ssize_t length = readUpTo(fd.get(), buffer);
  if (length < 0) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot read kestrel channel: %s",
          SXPosixError(path, errno));
    return std::nullopt;
  }
  auto value = static_cast<size_t>(length) <= kMaxCounterBytes
                   ? parseCounter(std::string_view(buffer).substr(0, length))
                   : std::nullopt;
  if (!value) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "kestrel channel %s does not hold a decimal integer",
          path);
  }
  return value;
}
