#include "platform/directory.h"

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <cerrno>

namespace tarvod {
namespace {

// Entries of large directories (groups with many members) need bigger buffers; the look-ups
// grow theirs on ERANGE up to these limits and fail beyond them.
constexpr size_t kInitialBuffer = 4096;
constexpr size_t kMaxBuffer = 8 * 1024 * 1024;
constexpr int kMaxGroups = 65536;

// Calls a reentrant getpwnam_r/getgrnam_r-style function, growing the buffer while the entry
// does not fit. Returns the entry, or nullptr when there is none or the look-up failed.
template <typename Entry, typename Function>
Entry* LookUpEntry(Function function, const std::string& name, Entry& entry,
                   std::vector<char>& buffer) {
  buffer.resize(kInitialBuffer);
  for (;;) {
    Entry* found = nullptr;
    const int error = function(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
    if (error == ERANGE && buffer.size() < kMaxBuffer) {
      buffer.resize(buffer.size() * 2);
      continue;
    }
    return error == 0 ? found : nullptr;
  }
}

}  // namespace

std::optional<UserRecord> LookUpUser(const std::string& name) {
  if (name.empty()) return std::nullopt;
  struct passwd entry {};
  std::vector<char> buffer;
  const struct passwd* found = LookUpEntry(getpwnam_r, name, entry, buffer);
  if (found == nullptr) return std::nullopt;
  UserRecord user;
  user.name = found->pw_name ? found->pw_name : name;
  user.uid = found->pw_uid;
  user.gid = found->pw_gid;
  user.home = found->pw_dir ? found->pw_dir : "";
  user.shell = found->pw_shell ? found->pw_shell : "";
  return user;
}

std::optional<gid_t> LookUpGroupID(const std::string& name) {
  if (name.empty()) return std::nullopt;
  struct group entry {};
  std::vector<char> buffer;
  const struct group* found = LookUpEntry(getgrnam_r, name, entry, buffer);
  if (found == nullptr) return std::nullopt;
  return found->gr_gid;
}

std::vector<gid_t> GroupsOfUser(const UserRecord& user) {
  int count = 32;
  std::vector<gid_t> groups;
  while (true) {
    groups.resize(static_cast<size_t>(count));
    int n = count;
    if (getgrouplist(user.name.c_str(), user.gid, groups.data(), &n) >= 0) {
      groups.resize(static_cast<size_t>(n));
      break;
    }
    // n now holds the number needed; a list that keeps growing past the limit is a failure.
    if (n <= count || n > kMaxGroups) return {};
    count = n;
  }
  // getgrouplist puts the primary group in the list; make sure it comes first.
  auto primary = std::find(groups.begin(), groups.end(), user.gid);
  if (primary == groups.end()) {
    groups.insert(groups.begin(), user.gid);
  } else {
    std::rotate(groups.begin(), primary, primary + 1);
  }
  return groups;
}

bool UserIsMemberOfGroup(const std::string& user, const std::string& group) {
  const auto record = LookUpUser(user);
  if (!record) return false;
  const auto gid = LookUpGroupID(group);
  if (!gid) return false;
  if (record->gid == *gid) return true;
  const std::vector<gid_t> groups = GroupsOfUser(*record);
  return std::find(groups.begin(), groups.end(), *gid) != groups.end();
}

}  // namespace tarvod
