#include "linux/InotifyNotifications.h"

#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <set>
#include <system_error>

#include "linux/PosixFileSystem.h"

namespace {

constexpr unsigned kDirectoryMode = 0755;
constexpr uint32_t kWatchMask = IN_CLOSE_WRITE | IN_ATTRIB | IN_MOVED_TO | IN_ONLYDIR;

// Tokens are unique across every adapter of the process, so a handler shared by two adapters
// can still tell its registrations apart.
std::atomic<int> gNextToken{1};

void CloseIfOpen(int& fd) {
  if (fd >= 0) ::close(fd);
  fd = -1;
}

// Posting is opening `name` in `directory` for writing and closing it.
int PostTo(const std::string& directory, const std::string& name) {
  if (int status = SXInotifyNotifications::checkName(name)) return status;
  std::string path = directory + "/" + name;
  // O_NONBLOCK keeps a FIFO planted under the name from blocking the poster.
  const int flags = O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK;
  int fd = ::open(path.c_str(), flags, 0644);
  if (fd < 0 && errno == ENOENT) {
    // The directory is not there (yet, or any more); a post (re)creates it.
    (void)SXPosixFileSystem().createDirectory(directory, kDirectoryMode);  // the open tells
    fd = ::open(path.c_str(), flags, 0644);
  }
  if (fd < 0) return errno;
  // Closing a descriptor opened for writing is what watchers see (IN_CLOSE_WRITE).
  ::close(fd);
  return 0;
}

}  // namespace

SXInotifyNotifications::SXInotifyNotifications(std::string runtimeDir,
                                               std::shared_ptr<SXLogFacility> log)
    : directory_(std::move(runtimeDir) + "/notify"), log_(std::move(log)) {
  setupError_ = setUp();
  if (setupError_ != 0) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot watch notifications: %s",
          SXErrnoText(directory_, setupError_));
    CloseIfOpen(inotifyFd_);
    CloseIfOpen(wakeFd_);
  }
}

SXInotifyNotifications::~SXInotifyNotifications() {
  if (watcher_.joinable()) {
    uint64_t one = 1;
    // An eventfd write of 1 fails only when the counter would overflow, which leaves it readable.
    while (::write(wakeFd_, &one, sizeof one) < 0 && errno == EINTR) {
    }
    watcher_.join();
  }
  CloseIfOpen(inotifyFd_);
  CloseIfOpen(wakeFd_);
}

int SXInotifyNotifications::setUp() {
  if (SXStatus made = SXPosixFileSystem().createDirectory(directory_, kDirectoryMode); !made.ok()) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "cannot create notify directory: %s", made.error());
  }
  inotifyFd_ = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (inotifyFd_ < 0) return errno;
  if (::inotify_add_watch(inotifyFd_, directory_.c_str(), kWatchMask) < 0) return errno;
  wakeFd_ = ::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  if (wakeFd_ < 0) return errno;
  try {
    watcher_ = std::thread([this] { watch(); });
  } catch (const std::system_error& error) {
    return error.code().value() != 0 ? error.code().value() : EAGAIN;
  }
  return 0;
}

int SXInotifyNotifications::checkName(const std::string& name) {
  if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos ||
      name.find('\0') != std::string::npos) {
    return EINVAL;
  }
  return name.size() > NAME_MAX ? ENAMETOOLONG : 0;
}

int SXInotifyNotifications::registerDispatch(const std::string& name, int& token,
                                             std::shared_ptr<SXWorkQueue> queue,
                                             SXNotifyHandler handler) {
  if (int status = checkName(name)) return status;
  if (!queue || !handler) return EINVAL;
  if (setupError_ != 0) return setupError_;
  int newToken = gNextToken.fetch_add(1);
  {
    SXMutexLock lock(mutex_);
    registrations_.emplace(name, Registration{newToken, std::move(queue), std::move(handler)});
  }
  token = newToken;
  return 0;
}

int SXInotifyNotifications::post(const std::string& name) { return PostTo(directory_, name); }

SXStatus SXInotifyNotifications::postIn(const std::string& runtimeDir, const std::string& name) {
  if (int error = PostTo(runtimeDir + "/notify", name)) {
    return SXErrnoStatus("cannot post " + name, error);
  }
  return {};
}

void SXInotifyNotifications::watch() {
  pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {wakeFd_, POLLIN, 0}};
  for (;;) {
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      SXLOG(*log_, nullptr, SXLogLevel::kError, "notification watcher stops: %s",
            SXErrnoText("poll", errno));
      return;
    }
    if (fds[1].revents != 0) return;
    if (fds[0].revents == 0) continue;
    WatchState state = readEvents();
    if (state == WatchState::kRemoved) state = rewatch();
    if (state != WatchState::kWatching) return;
  }
}

SXInotifyNotifications::WatchState SXInotifyNotifications::readEvents() {
  alignas(inotify_event) char buffer[16 * (sizeof(inotify_event) + NAME_MAX + 1)];
  std::set<std::string> names;  // several posts of a name in one batch are one delivery
  bool overflow = false;
  WatchState state = WatchState::kWatching;
  for (;;) {
    ssize_t n = ::read(inotifyFd_, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && errno == EAGAIN) break;
    if (n <= 0) {
      SXLOG(*log_, nullptr, SXLogLevel::kError, "notification watcher stops: %s",
            SXErrnoText("inotify read", n < 0 ? errno : EIO));
      state = WatchState::kBroken;
      break;
    }
    for (size_t offset = 0; offset + sizeof(inotify_event) <= size_t(n);) {
      inotify_event event;
      std::memcpy(&event, buffer + offset, sizeof event);
      const char* name = buffer + offset + sizeof event;
      if (event.mask & IN_Q_OVERFLOW) overflow = true;
      if ((event.mask & IN_IGNORED) && state == WatchState::kWatching) {
        state = WatchState::kRemoved;
      }
      if (event.len > 0) names.emplace(name, ::strnlen(name, event.len));
      offset += sizeof event + event.len;
    }
  }
  if (overflow) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "notification events lost; delivering all");
  }
  deliver({names.begin(), names.end()}, overflow);
  return state;
}

SXInotifyNotifications::WatchState SXInotifyNotifications::rewatch() {
  // The directory was removed (or its file system unmounted): start over on a new one, so an
  // administrator's clean-up does not silence notifications for the rest of the process's life.
  (void)SXPosixFileSystem().createDirectory(directory_, kDirectoryMode);  // the watch tells
  if (::inotify_add_watch(inotifyFd_, directory_.c_str(), kWatchMask) < 0) {
    SXLOG(*log_, nullptr, SXLogLevel::kError, "notification watcher stops: %s",
          SXErrnoText(directory_, errno));
    return WatchState::kBroken;
  }
  SXLOG(*log_, nullptr, SXLogLevel::kInfo, "notify directory %s watched again", directory_);
  return WatchState::kWatching;
}

void SXInotifyNotifications::deliver(const std::vector<std::string>& names, bool everything) {
  std::vector<Registration> due;
  {
    SXMutexLock lock(mutex_);
    if (everything) {
      for (const auto& [name, registration] : registrations_) due.push_back(registration);
    } else {
      for (const std::string& name : names) {
        auto [first, last] = registrations_.equal_range(name);
        for (auto it = first; it != last; ++it) due.push_back(it->second);
      }
    }
  }
  // Queued outside the lock: a queue may run the task inline or block on its own lock.
  for (Registration& registration : due) {
    registration.queue->async(
        [handler = std::move(registration.handler), token = registration.token, log = log_] {
          try {
            handler(token);
          } catch (...) {
            SXLOG(*log, nullptr, SXLogLevel::kError, "notification handler %d threw", token);
          }
        });
  }
}
