#include "platform/FileSystem.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

SXScopedFd::~SXScopedFd() {
  if (fd_ >= 0) ::close(fd_);
}

std::string SXPosixError(const std::string& context, int errnum) {
  return context + ": " + std::strerror(errnum);
}

std::optional<std::string> SXPosixFileSystem::createDirectory(const std::string& path,
                                                              unsigned mode) {
  std::string partial;
  size_t pos = 0;
  while (pos != std::string::npos) {
    pos = path.find('/', pos + 1);
    partial = path.substr(0, pos);
    if (partial.empty()) continue;
    if (::mkdir(partial.c_str(), static_cast<mode_t>(mode)) == 0) {
      ::chmod(partial.c_str(), static_cast<mode_t>(mode));  // not narrowed by the umask
      continue;
    }
    if (errno == EEXIST) {
      struct stat st {};
      if (::stat(partial.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) continue;
      return SXPosixError(partial, ENOTDIR);
    }
    return SXPosixError(partial, errno);
  }
  return std::nullopt;
}

std::optional<std::string> SXPosixFileSystem::writeFileAtomically(const std::string& path,
                                                                  const std::string& contents) {
  std::string temp = path + ".tmp." + std::to_string(::getpid());
  int fd = ::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) return SXPosixError(temp, errno);
  size_t done = 0;
  while (done < contents.size()) {
    ssize_t n = ::write(fd, contents.data() + done, contents.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      int err = errno;
      ::close(fd);
      ::unlink(temp.c_str());
      return SXPosixError(temp, err);
    }
    done += static_cast<size_t>(n);
  }
  int err = ::fsync(fd) == 0 ? 0 : errno;
  if (::close(fd) != 0 && err == 0) err = errno;
  if (err != 0) {
    ::unlink(temp.c_str());
    return SXPosixError(temp, err);
  }
  if (::rename(temp.c_str(), path.c_str()) != 0) {
    int err = errno;
    ::unlink(temp.c_str());
    return SXPosixError(path, err);
  }
  return std::nullopt;
}
