// The file-system adapter on POSIX calls, and the descriptor owner the other Linux adapters
// share.
#pragma once

#include <string>

#include "platform/FileSystem.h"

class SXPosixFileSystem final : public SXFileSystem {
 public:
  SXStatus createDirectory(const std::string& path, unsigned mode) override;
  SXStatus writeFileAtomically(const std::string& path, const std::string& contents) override;
  SXStatus writeNewFileAtomically(const std::string& path, const std::string& contents,
                                  bool& taken) override;

 private:
  // `taken`: null to replace what is at `path`, else set when something is there.
  SXStatus write(const std::string& path, const std::string& contents, bool* taken);
};

// Owns one file descriptor and closes it (which also releases an flock taken through it).
class SXScopedFd {
 public:
  explicit SXScopedFd(int fd) : fd_(fd) {}
  ~SXScopedFd();
  SXScopedFd(const SXScopedFd&) = delete;
  SXScopedFd& operator=(const SXScopedFd&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};
