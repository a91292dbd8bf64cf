#include "platform/files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

namespace tarvod {
namespace {

// Most state files are a few kilobytes; a larger one is read in pieces of this size, up to
// a bound that keeps a planted file from exhausting memory.
constexpr size_t kReadChunk = 64 * 1024;
constexpr size_t kMaxOwnedFileBytes = 256 * 1024 * 1024;

std::string DirectoryOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

Status WriteAll(int fd, const std::string& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Status::Error(errno, "write");
    done += static_cast<size_t>(n);
  }
  return Status::Ok();
}

class PosixFiles final : public Files {
 public:
  Status makeDirectories(const std::string& path, mode_t mode) override {
    std::string prefix;
    size_t start = 0;
    while (start <= path.size()) {
      size_t slash = path.find('/', start);
      if (slash == std::string::npos) slash = path.size();
      prefix = path.substr(0, slash);
      start = slash + 1;
      if (prefix.empty()) continue;
      if (::mkdir(prefix.c_str(), mode) != 0 && errno != EEXIST) {
        return Status::Error(errno, "mkdir " + prefix);
      }
    }
    struct stat info {};
    if (::stat(path.c_str(), &info) != 0) return Status::Error(errno, "stat " + path);
    if (!S_ISDIR(info.st_mode)) return Status::Error(ENOTDIR, "mkdir " + path);
    return Status::Ok();
  }

  bool exists(const std::string& path) override {
    struct stat info {};
    return ::lstat(path.c_str(), &info) == 0;
  }

  Status remove(const std::string& path) override {
    if (::unlink(path.c_str()) != 0) return Status::Error(errno, "unlink " + path);
    return Status::Ok();
  }

  Status link(const std::string& from, const std::string& to) override {
    if (::link(from.c_str(), to.c_str()) != 0) return Status::Error(errno, "link " + to);
    return Status::Ok();
  }

  Status rename(const std::string& from, const std::string& to) override {
    if (::rename(from.c_str(), to.c_str()) != 0) return Status::Error(errno, "rename " + from);
    return SyncDirectory(DirectoryOf(to));
  }

  Status writeAtomically(const std::string& path, const std::string& bytes) override {
    const std::string auxiliary = path + ".new";
    ::unlink(auxiliary.c_str());  // a leftover of an interrupted write
    const int fd =
        ::open(auxiliary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0) return Status::Error(errno, "open " + auxiliary);
    Status status = WriteAll(fd, bytes);
    if (status.ok() && ::fsync(fd) != 0) status = Status::Error(errno, "fsync " + auxiliary);
    if (::close(fd) != 0 && status.ok()) status = Status::Error(errno, "close " + auxiliary);
    if (status.ok() && ::rename(auxiliary.c_str(), path.c_str()) != 0) {
      status = Status::Error(errno, "rename " + auxiliary);
    }
    if (!status.ok()) {
      ::unlink(auxiliary.c_str());
      return status;
    }
    return SyncDirectory(DirectoryOf(path));
  }

  Result<std::string> readOwnedFile(const std::string& path) override {
    const int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) return Status::Error(errno, "open " + path);
    struct stat info {};
    if (::fstat(fd, &info) != 0 || !S_ISREG(info.st_mode) || info.st_uid != ::geteuid()) {
      ::close(fd);
      return Status::Error(EPERM, "not a regular file of ours: " + path);
    }
    std::string bytes;
    for (;;) {
      const size_t old = bytes.size();
      if (old >= kMaxOwnedFileBytes) {
        ::close(fd);
        return Status::Error(EFBIG, "read " + path);
      }
      bytes.resize(old + kReadChunk);
      const ssize_t n = ::read(fd, bytes.data() + old, kReadChunk);
      if (n < 0 && errno == EINTR) {
        bytes.resize(old);
        continue;
      }
      if (n < 0) {
        const int error = errno;
        ::close(fd);
        return Status::Error(error, "read " + path);
      }
      bytes.resize(old + static_cast<size_t>(n));
      if (n == 0) break;
    }
    ::close(fd);
    return bytes;
  }

 private:
  static Status SyncDirectory(const std::string& directory) {
    const int fd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return Status::Error(errno, "open " + directory);
    const bool synced = ::fsync(fd) == 0;
    const int error = errno;
    ::close(fd);
    return synced ? Status::Ok() : Status::Error(error, "fsync " + directory);
  }
};

}  // namespace

Files& Files::Real() {
  static PosixFiles files;
  return files;
}

}  // namespace tarvod
