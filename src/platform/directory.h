// Directory services: users and groups by name, and group membership. Thread-safe (only the
// re-entrant host calls are used); may be called from any thread.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace tarvod {

struct UserRecord {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;  // the primary group
  std::string home;
  std::string shell;
};

// nullopt when the user does not exist or the look-up failed.
std::optional<UserRecord> LookUpUser(const std::string& name);
// The group's ID; nullopt when the group does not exist or the look-up failed.
std::optional<gid_t> LookUpGroupID(const std::string& name);
// The user's primary group followed by its supplementary groups; empty on failure.
std::vector<gid_t> GroupsOfUser(const UserRecord& user);
// True when the user exists, the group exists and the group is the user's primary group or
// one of its supplementary groups; every failure reads as false.
bool UserIsMemberOfGroup(const std::string& user, const std::string& group);

}  // namespace tarvod
