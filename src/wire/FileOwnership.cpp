#include "wire/FileOwnership.h"

#include <array>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fmt/format.h>

namespace mx {

std::string userName(uid_t user)
{
    struct passwd entry {};
    struct passwd* found = nullptr;
    std::array<char, 4096> buffer{};
    getpwuid_r(user, &entry, buffer.data(), buffer.size(), &found);
    return found ? found->pw_name : std::to_string(user);
}

std::string groupName(gid_t group)
{
    struct group entry {};
    struct group* found = nullptr;
    std::array<char, 4096> buffer{};
    getgrgid_r(group, &entry, buffer.data(), buffer.size(), &found);
    return found ? found->gr_name : std::to_string(group);
}

std::string processOwner() { return userName(geteuid()) + ":" + groupName(getegid()); }

std::string describeOwnership(const std::filesystem::path& path, std::string_view self)
{
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0)
        return "";
    return fmt::format("{} is owned by {}:{}, mode {:04o}; {} {}", path.string(), userName(status.st_uid),
                       groupName(status.st_gid), status.st_mode & 07777, self, processOwner());
}

std::string owningGroup(const std::filesystem::path& path)
{
    struct stat status {};
    return ::stat(path.c_str(), &status) == 0 ? groupName(status.st_gid) : "";
}

} // namespace mx
