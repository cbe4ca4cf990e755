#include "linux/FileKestrel.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <initializer_list>
#include <string_view>
#include <vector>

#include "linux/PosixFileSystem.h"

namespace {

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

// `root`/`names...` opened one directory at a time without following a symlink, so nothing in
// the tree can lead outside it. -1 with errno set when one is missing, no directory or a symlink.
int openTreeDirectory(int root, std::initializer_list<std::string_view> names) {
  int fd = ::fcntl(root, F_DUPFD_CLOEXEC, 0);
  for (auto name : names) {
    if (fd < 0) break;
    int next =
        ::openat(fd, std::string(name).c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    int err = errno;
    ::close(fd);
    fd = next;
    errno = err;
  }
  return fd;
}

// The root, which may itself be a symlink: it is configuration, not driver output.
int openRoot(const std::string& root) {
  return ::open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
}

// Missing, not a directory, or a symlink (O_NOFOLLOW with O_DIRECTORY gives ENOTDIR).
bool isAbsent(int err) { return err == ENOENT || err == ENOTDIR; }

// The visible entries of one kind in the directory `names...` below `root`; symlinks are
// neither. Nothing when the directory is absent (no error) or cannot be listed (error set).
std::optional<std::vector<std::string>> listEntries(int root,
                                                    std::initializer_list<std::string_view> names,
                                                    EntryKind kind,
                                                    std::optional<KestrelError>& error) {
  int fd = openTreeDirectory(root, names);
  DIR* dir = fd < 0 ? nullptr : ::fdopendir(fd);
  if (!dir) {
    int err = errno;
    if (fd >= 0) ::close(fd);
    if (!isAbsent(err)) setError(error, err);
    return std::nullopt;
  }
  std::vector<std::string> found;
  errno = 0;
  while (const dirent* entry = ::readdir(dir)) {
    struct stat st {};
    if (isTreeName(entry->d_name) &&
        ::fstatat(::dirfd(dir), entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
        (kind == EntryKind::kDirectory ? S_ISDIR(st.st_mode) : S_ISREG(st.st_mode))) {
      found.emplace_back(entry->d_name);
    }
    errno = 0;
  }
  if (errno != 0) setError(error, errno);
  ::closedir(dir);
  return found;
}

// `wanted` alone when the caller names it, otherwise every visible directory in `names...`.
std::vector<std::string> directoriesNamed(const std::optional<std::string>& wanted, int root,
                                          std::initializer_list<std::string_view> names,
                                          std::optional<KestrelError>& error) {
  if (wanted) return {*wanted};
  return listEntries(root, names, EntryKind::kDirectory, error)
      .value_or(std::vector<std::string>{});
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
  SXScopedFd root(openRoot(root_));
  if (root.get() < 0) {
    if (!isAbsent(errno)) setError(error, errno);
    return std::nullopt;
  }
  // A matching subgroup directory, even an empty one, makes a (possibly empty) dictionary.
  std::optional<SXValue> channels;
  for (const auto& g : directoriesNamed(group, root.get(), {}, error)) {
    for (const auto& s : directoriesNamed(subgroup, root.get(), {g}, error)) {
      auto files = listEntries(root.get(), {g, s}, EntryKind::kFile, error);
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
    auto value = readCounter(key, *parts);
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

std::optional<int64_t> SXFileKestrel::readCounter(
    const std::string& key, const std::array<std::string_view, 3>& parts) const {
  const std::string path = root_ + "/" + key;
  SXScopedFd root(openRoot(root_));
  SXScopedFd dir(root.get() < 0 ? -1 : openTreeDirectory(root.get(), {parts[0], parts[1]}));
  // Non-blocking, so that a FIFO put where a counter belongs cannot stall sampling; a symlink
  // is refused (ELOOP) like any unreadable counter.
  SXScopedFd fd(dir.get() < 0 ? -1
                              : ::openat(dir.get(), std::string(parts[2]).c_str(),
                                         O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
  if (fd.get() < 0) {
    // A channel that went away since the subscription is simply not sampled.
    if (errno != ENOENT && errno != ENOTDIR) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot read kestrel channel: %s",
            SXErrnoText(path, errno));
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
          SXErrnoText(path, errno));
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
