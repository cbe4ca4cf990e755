#include "linux/PosixFileSystem.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>

namespace {

// Attempts at a fresh temporary name before giving up; a clash needs someone creating names
// in the directory, and each attempt draws 64 new random bits.
constexpr int kTemporaryNameAttempts = 16;

// 16 hex digits nobody can guess ahead. Should the kernel's pool not be ready yet (early boot),
// the time, pid and a counter still keep names apart; O_EXCL keeps the open safe either way.
std::string randomSuffix() {
  static std::atomic<uint64_t> counter{0};
  uint64_t bits = 0;
  if (::getrandom(&bits, sizeof bits, GRND_NONBLOCK) != static_cast<ssize_t>(sizeof bits)) {
    bits = static_cast<uint64_t>(std::chrono::steady_clock::now().time_since_epoch().count()) ^
           (static_cast<uint64_t>(::getpid()) << 32) ^ (counter++ * 0x9E3779B97F4A7C15ull);
  }
  char text[17];
  std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(bits));
  return text;
}

// Writes all of `contents`; 0 or the errno of the failing write.
int writeAll(int fd, const std::string& contents) {
  size_t done = 0;
  while (done < contents.size()) {
    ssize_t n = ::write(fd, contents.data() + done, contents.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    done += static_cast<size_t>(n);
  }
  return 0;
}

}  // namespace

SXScopedFd::~SXScopedFd() {
  if (fd_ >= 0) ::close(fd_);
}

SXStatus SXPosixFileSystem::createDirectory(const std::string& path, unsigned mode) {
  if (path.empty()) return SXErrnoStatus(path, ENOENT);
  // Each component is made and opened relative to its parent's descriptor, so a directory made
  // here and swapped for a symlink before its child is made is never followed.
  SXScopedFd parent(::open(path[0] == '/' ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (parent.get() < 0) return SXErrnoStatus(path[0] == '/' ? "/" : ".", errno);
  int dir = parent.get();
  std::optional<SXScopedFd> child;
  size_t start = 0;
  while (start < path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    std::string name = path.substr(start, end - start);
    std::string partial = path.substr(0, end);
    start = end + 1;
    if (name.empty() || name == ".") continue;
    // The umask narrows `mode`: the daemon's directories are never more open than it allows.
    bool made = ::mkdirat(dir, name.c_str(), static_cast<mode_t>(mode)) == 0;
    if (!made && errno != EEXIST) return SXErrnoStatus(partial, errno);
    // A directory that was there already may be a symlink the administrator set up.
    int next =
        ::openat(dir, name.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC | (made ? O_NOFOLLOW : 0));
    if (next < 0) return SXErrnoStatus(partial, errno);
    child.emplace(next);
    dir = child->get();
  }
  return {};
}

SXStatus SXPosixFileSystem::writeFileAtomically(const std::string& path,
                                                const std::string& contents) {
  return write(path, contents, nullptr);
}

SXStatus SXPosixFileSystem::writeNewFileAtomically(const std::string& path,
                                                   const std::string& contents, bool& taken) {
  taken = false;
  return write(path, contents, &taken);
}

SXStatus SXPosixFileSystem::write(const std::string& path, const std::string& contents,
                                  bool* taken) {
  size_t slash = path.rfind('/');
  std::string directory = slash == std::string::npos ? "." : path.substr(0, slash ? slash : 1);
  std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  if (name.empty() || name == "." || name == "..") return SXErrnoStatus(path, EINVAL);
  // Everything below happens relative to this descriptor: a symlink put in the directory's
  // place, before or during the write, cannot move the file elsewhere.
  SXScopedFd dir(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dir.get() < 0) {
    int err = errno;
    struct stat st {};
    if (::lstat(directory.c_str(), &st) == 0 && S_ISLNK(st.st_mode)) {
      return SXFailure(directory + ": is a symbolic link, not followed");
    }
    return SXErrnoStatus(directory, err);
  }
  // A fresh name that nobody can plant anything at ahead of time; O_EXCL refuses whatever is
  // there all the same, a symlink included.
  std::string temp;
  int fd = -1;
  for (int attempt = 0; fd < 0 && attempt < kTemporaryNameAttempts; ++attempt) {
    temp = name + ".tmp." + randomSuffix();
    fd = ::openat(dir.get(), temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                  0640);
    if (fd < 0 && errno != EEXIST) break;
  }
  if (fd < 0) return SXErrnoStatus(directory + "/" + temp, errno);
  int err = writeAll(fd, contents);
  if (err == 0 && ::fsync(fd) != 0) err = errno;
  if (::close(fd) != 0 && err == 0) err = errno;
  if (err != 0) {
    ::unlinkat(dir.get(), temp.c_str(), 0);
    return SXErrnoStatus(directory + "/" + temp, err);
  }
  // rename replaces a symlink at `name` instead of writing through it; link refuses anything
  // at `name`, a symlink included.
  bool placed = taken ? ::linkat(dir.get(), temp.c_str(), dir.get(), name.c_str(), 0) == 0
                      : ::renameat(dir.get(), temp.c_str(), dir.get(), name.c_str()) == 0;
  err = placed ? 0 : errno;
  if (!placed || taken) ::unlinkat(dir.get(), temp.c_str(), 0);
  if (taken && err == EEXIST) {
    *taken = true;
    return {};
  }
  if (err != 0) return SXErrnoStatus(path, err);
  return {};
}
