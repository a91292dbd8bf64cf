// Files that hold secrets, such as the keychain store: a secret file is usable only when it is
// a regular file owned by root with no group or other permission bits, reached without
// following a symbolic link. Safe to call from any thread.
#pragma once

#include <cstdint>
#include <string>

#include "platform/status.h"

namespace tarvod {

// What identifies one version of a file: its device and inode, and its modification time.
struct FileStamp {
  uint64_t device = 0;
  uint64_t inode = 0;
  int64_t modifiedSeconds = 0;
  int64_t modifiedNanoseconds = 0;
  bool operator==(const FileStamp&) const = default;
};

struct SecretFile {
  std::string bytes;
  FileStamp stamp;
};

// Secret files larger than this are refused: a store of passwords stays far below it.
inline constexpr size_t kMaxSecretFileBytes = 4 * 1024 * 1024;

// The stamp of the secret file at path, from one lstat, without opening it. On failure the
// status carries the errno (ENOENT when nothing is there, ELOOP for a link, EPERM for a file
// that is not a root-only regular file, EFBIG for one too large) and what() the whole reason,
// path included.
Result<FileStamp> StampSecretFile(const std::string& path);
// The content and stamp of the secret file at path, opened without following a link and
// checked on the open descriptor. Failures as for StampSecretFile.
Result<SecretFile> ReadSecretFile(const std::string& path);

}  // namespace tarvod
