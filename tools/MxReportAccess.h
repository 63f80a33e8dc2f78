#pragma once
// What mxreport says when a file or socket of the daemon's refuses this user: who owns
// it, its mode and who this user is, so that the fix (a group to join, a user to run
// as) is plain.

#include <filesystem>
#include <string>
#include <sys/types.h>

namespace mx {

// The group's name, or its number when it has none.
std::string groupName(gid_t group);
// "PATH is owned by USER:GROUP, mode 0755; this is USER:GROUP", or "" when it
// cannot be looked at.
std::string ownership(const std::filesystem::path& path);
// The group owning `path`, or "" when it cannot be looked at.
std::string owningGroup(const std::filesystem::path& path);

} // namespace mx
