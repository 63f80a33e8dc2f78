#include "tools/MxReportAccess.h"

#include <array>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fmt/format.h>

namespace mx {

namespace {

std::string userName(uid_t user)
{
    struct passwd entry {};
    struct passwd* found = nullptr;
    std::array<char, 4096> buffer{};
    getpwuid_r(user, &entry, buffer.data(), buffer.size(), &found);
    return found ? found->pw_name : std::to_string(user);
}

} // namespace

std::string groupName(gid_t group)
{
    struct group entry {};
    struct group* found = nullptr;
    std::array<char, 4096> buffer{};
    getgrgid_r(group, &entry, buffer.data(), buffer.size(), &found);
    return found ? found->gr_name : std::to_string(group);
}

std::string ownership(const std::filesystem::path& path)
{
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0)
        return "";
    return fmt::format("{} is owned by {}:{}, mode {:04o}; this is {}:{}", path.string(), userName(status.st_uid),
                       groupName(status.st_gid), status.st_mode & 07777, userName(geteuid()), groupName(getegid()));
}

std::string owningGroup(const std::filesystem::path& path)
{
    struct stat status {};
    return ::stat(path.c_str(), &status) == 0 ? groupName(status.st_gid) : "";
}

} // namespace mx
