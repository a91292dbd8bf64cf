// The file operations of saved state, behind an interface so that tests can make any step
// fail. Every call may be made from any thread; failures come back as a Status.
#pragma once

#include <sys/types.h>

#include <string>

#include "platform/status.h"

namespace tarvod {

class Files {
 public:
  virtual ~Files() = default;

  // Creates path and its missing parents with mode; an existing directory is success.
  virtual Status makeDirectories(const std::string& path, mode_t mode) = 0;
  // True when something (even a dangling link) is at path.
  virtual bool exists(const std::string& path) = 0;
  virtual Status remove(const std::string& path) = 0;
  // Gives the file at from a second name; fails when to exists.
  virtual Status link(const std::string& from, const std::string& to) = 0;
  // Replaces to with from in one step.
  virtual Status rename(const std::string& from, const std::string& to) = 0;
  // Writes bytes so that, after a crash or power cut at any instant, path holds either its
  // old content or all of the new: an auxiliary file is written, synced and renamed over
  // path, then the directory is synced. Mode 0600 for a new file.
  virtual Status writeAtomically(const std::string& path, const std::string& bytes) = 0;
  // The content of a regular file owned by this process's effective user, opened without
  // following a link at path. Anything else fails with EPERM.
  virtual Result<std::string> readOwnedFile(const std::string& path) = 0;

  // The host's file system; lives as long as the process.
  static Files& Real();
};

}  // namespace tarvod
