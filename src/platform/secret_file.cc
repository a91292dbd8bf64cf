#include "platform/secret_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace tarvod {
namespace {

FileStamp StampOf(const struct stat& info) {
  return FileStamp{
      .device = static_cast<uint64_t>(info.st_dev),
      .inode = static_cast<uint64_t>(info.st_ino),
      .modifiedSeconds = static_cast<int64_t>(info.st_mtim.tv_sec),
      .modifiedNanoseconds = static_cast<int64_t>(info.st_mtim.tv_nsec),
  };
}

// Ok when info describes a root-only regular file; the refusal names the path and the reason.
Status CheckSecretFile(const std::string& path, const struct stat& info) {
  if (S_ISLNK(info.st_mode)) return Status::Error(ELOOP, path + " is a symbolic link");
  if (!S_ISREG(info.st_mode)) return Status::Error(EPERM, path + " is not a regular file");
  if (info.st_uid != 0) {
    return Status::Error(
        EPERM, path + " is owned by uid " + std::to_string(info.st_uid) + ", not by root");
  }
  if ((info.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
    char mode[8];
    std::snprintf(mode, sizeof mode, "%04o", static_cast<unsigned>(info.st_mode & 07777));
    return Status::Error(
        EPERM, path + " has group or other permission bits (mode " + std::string(mode) + ")");
  }
  if (static_cast<uint64_t>(info.st_size) > kMaxSecretFileBytes) {
    return Status::Error(
        EFBIG, path + " is larger than " + std::to_string(kMaxSecretFileBytes) + " bytes");
  }
  return Status::Ok();
}

Status OpenFailure(const std::string& path, int error) {
  return Status::Error(error, path + " cannot be opened: " + std::strerror(error));
}

}  // namespace

Result<FileStamp> StampSecretFile(const std::string& path) {
  struct stat info {};
  if (::lstat(path.c_str(), &info) != 0) return OpenFailure(path, errno);
  Status status = CheckSecretFile(path, info);
  if (!status.ok()) return status;
  return StampOf(info);
}

Result<SecretFile> ReadSecretFile(const std::string& path) {
  // O_NOFOLLOW refuses a link at path; O_NONBLOCK keeps a FIFO planted there from hanging the
  // open, and the check on the descriptor refuses it afterwards.
  const int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) {
    if (errno == ELOOP) return Status::Error(ELOOP, path + " is a symbolic link");
    return OpenFailure(path, errno);
  }
  struct stat info {};
  Status status = ::fstat(fd, &info) == 0 ? CheckSecretFile(path, info) : OpenFailure(path, errno);
  SecretFile file;
  if (status.ok()) {
    file.stamp = StampOf(info);
    // One byte more than the limit tells a file that grew since the check.
    file.bytes.resize(kMaxSecretFileBytes + 1);
    size_t done = 0;
    while (done < file.bytes.size()) {
      const ssize_t n = ::read(fd, file.bytes.data() + done, file.bytes.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) {
        status = Status::Error(errno, path + " cannot be read: " + std::strerror(errno));
        break;
      }
      if (n == 0) break;
      done += static_cast<size_t>(n);
    }
    file.bytes.resize(done);
    if (status.ok() && done > kMaxSecretFileBytes) {
      status = Status::Error(
          EFBIG, path + " is larger than " + std::to_string(kMaxSecretFileBytes) + " bytes");
    }
  }
  ::close(fd);
  if (!status.ok()) return status;
  return file;
}

}  // namespace tarvod
