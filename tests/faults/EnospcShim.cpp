// An LD_PRELOAD library that plays a full or a slow disk for the end-to-end fault tests.
//
// While the file named by SXR_FAULT_TRIGGER exists, every write, pwrite, writev, fsync and
// fdatasync on a file whose path starts with SXR_FAULT_DIR fails with ENOSPC, or, when
// SXR_FAULT_DELAY_MS is set, waits that many milliseconds and then goes through; otherwise
// calls pass through untouched. Descriptors outside that directory (sockets, the log) are never
// affected. Without both variables the library does nothing.
#include <dlfcn.h>
#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/uio.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>

namespace {

template <typename F>
F next(const char* name) {
  return reinterpret_cast<F>(dlsym(RTLD_NEXT, name));
}

// True when the call must fail with ENOSPC (errno is set); a slow disk has waited and lets it
// through.
bool mustFail(int fd) {
  const char* dir = getenv("SXR_FAULT_DIR");
  const char* trigger = getenv("SXR_FAULT_TRIGGER");
  if (!dir || !trigger || !*dir || access(trigger, F_OK) != 0) return false;
  char link[64];
  char target[4096];
  std::snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
  int saved = errno;
  ssize_t n = readlink(link, target, sizeof target - 1);
  errno = saved;
  if (n <= 0) return false;
  target[n] = '\0';
  if (strncmp(target, dir, strlen(dir)) != 0) return false;
  const char* delay = getenv("SXR_FAULT_DELAY_MS");
  if (!delay || !*delay) {
    errno = ENOSPC;
    return true;
  }
  long ms = atol(delay);
  timespec wait{ms / 1000, (ms % 1000) * 1000000};
  while (nanosleep(&wait, &wait) != 0 && errno == EINTR) {
  }
  errno = saved;
  return false;
}

}  // namespace

extern "C" {

ssize_t write(int fd, const void* buf, size_t count) {
  static auto real = next<ssize_t (*)(int, const void*, size_t)>("write");
  return mustFail(fd) ? -1 : real(fd, buf, count);
}

ssize_t pwrite(int fd, const void* buf, size_t count, off_t offset) {
  static auto real = next<ssize_t (*)(int, const void*, size_t, off_t)>("pwrite");
  return mustFail(fd) ? -1 : real(fd, buf, count, offset);
}

ssize_t pwrite64(int fd, const void* buf, size_t count, off64_t offset) {
  static auto real = next<ssize_t (*)(int, const void*, size_t, off64_t)>("pwrite64");
  return mustFail(fd) ? -1 : real(fd, buf, count, offset);
}

ssize_t writev(int fd, const struct iovec* iov, int count) {
  static auto real = next<ssize_t (*)(int, const struct iovec*, int)>("writev");
  return mustFail(fd) ? -1 : real(fd, iov, count);
}

int fsync(int fd) {
  static auto real = next<int (*)(int)>("fsync");
  return mustFail(fd) ? -1 : real(fd);
}

int fdatasync(int fd) {
  static auto real = next<int (*)(int)>("fdatasync");
  return mustFail(fd) ? -1 : real(fd);
}

}  // extern "C"
