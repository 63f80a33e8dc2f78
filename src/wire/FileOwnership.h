#pragma once
// Who owns a file under the root and who this process is, by name: what the daemon
// and its clients say when a file or socket refuses them, so that the fix (a group to
// join, a user to run as, a mode) is plain.

#include <filesystem>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace mx {

// The names, or the numbers when they have none.
std::string userName(uid_t user);
std::string groupName(gid_t group);
// "USER:GROUP" of this process.
std::string processOwner();
// "PATH is owned by USER:GROUP, mode 0755; `self` USER:GROUP" (`self` as "this is"),
// or "" when it cannot be looked at.
std::string describeOwnership(const std::filesystem::path& path, std::string_view self);
// The group owning `path`, or "" when it cannot be looked at.
std::string owningGroup(const std::filesystem::path& path);

} // namespace mx
