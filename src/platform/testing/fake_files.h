// An in-memory file system for tests of saved state: files are path to bytes, and any
// operation on a given path can be made to fail.
#pragma once

#include <cerrno>
#include <map>
#include <set>
#include <string>
#include <utility>

#include "platform/files.h"

namespace tarvod {

class FakeFiles final : public Files {
 public:
  // Makes op ("write", "link", "rename", "read") fail on path (for rename and link: the
  // source path) with error.
  void failOn(const std::string& op, const std::string& path, int error = EIO) {
    mFailures[op + " " + path] = error;
  }

  std::map<std::string, std::string> files;
  std::set<std::string> directories;
  std::set<std::string> foreign;  // paths that readOwnedFile refuses

  Status makeDirectories(const std::string& path, mode_t) override {
    directories.insert(path);
    return Status::Ok();
  }
  bool exists(const std::string& path) override { return files.contains(path); }
  Status remove(const std::string& path) override {
    return files.erase(path) ? Status::Ok() : Status::Error(ENOENT, "unlink " + path);
  }
  Status link(const std::string& from, const std::string& to) override {
    if (int error = failure("link", from)) return Status::Error(error, "link " + to);
    if (!files.contains(from)) return Status::Error(ENOENT, "link " + to);
    if (files.contains(to)) return Status::Error(EEXIST, "link " + to);
    files[to] = files[from];
    return Status::Ok();
  }
  Status rename(const std::string& from, const std::string& to) override {
    if (int error = failure("rename", from)) return Status::Error(error, "rename " + from);
    auto found = files.find(from);
    if (found == files.end()) return Status::Error(ENOENT, "rename " + from);
    files[to] = std::move(found->second);
    files.erase(from);
    return Status::Ok();
  }
  Status writeAtomically(const std::string& path, const std::string& bytes) override {
    if (int error = failure("write", path)) return Status::Error(error, "write " + path);
    files[path] = bytes;
    return Status::Ok();
  }
  Result<std::string> readOwnedFile(const std::string& path) override {
    if (int error = failure("read", path)) return Status::Error(error, "read " + path);
    if (foreign.contains(path)) return Status::Error(EPERM, "read " + path);
    auto found = files.find(path);
    if (found == files.end()) return Status::Error(ENOENT, "open " + path);
    return found->second;
  }

 private:
  int failure(const std::string& op, const std::string& path) const {
    auto found = mFailures.find(op + " " + path);
    return found == mFailures.end() ? 0 : found->second;
  }
  std::map<std::string, int> mFailures;
};

}  // namespace tarvod
