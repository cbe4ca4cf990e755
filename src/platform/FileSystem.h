// File-system operations of the summary files. May be called from any thread.
#pragma once

#include <string>

#include "platform/Status.h"

class SXFileSystem {
 public:
  virtual ~SXFileSystem() = default;
  // Creates `path` with its missing parents and `mode` less the process umask (never wider).
  // An existing directory, or a symlink to one, is no failure; a directory made here that is
  // swapped for a symlink is not followed.
  virtual SXStatus createDirectory(const std::string& path, unsigned mode) = 0;
  // Writes `contents` so that a reader sees either no file or the whole file, replacing a file
  // (or symlink) of the same name; the new file is 0640 less the umask. Nothing is written
  // through a symlink: neither the directory named in `path` nor the file may be one.
  virtual SXStatus writeFileAtomically(const std::string& path, const std::string& contents) = 0;
  // As writeFileAtomically, but whatever is at `path` already is kept: then nothing is
  // written and `taken` is set.
  virtual SXStatus writeNewFileAtomically(const std::string& path, const std::string& contents,
                                          bool& taken) = 0;
};
