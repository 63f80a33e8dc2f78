#include "platform/linux/PosixFileSystem.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "wire/RootPath.h"

namespace mx {

namespace {

// strerror shares one buffer between threads; the GNU strerror_r does not.
std::string errnoText(int error)
{
    char buffer[256];
    return strerror_r(error, buffer, sizeof(buffer));
}

} // namespace

std::filesystem::path PosixFileSystem::resolve(const std::string& path) { return MxReportingPath(path); }

std::optional<std::string> PosixFileSystem::createDirectories(const std::filesystem::path& directory, mode_t mode)
{
    std::filesystem::path partial;
    for (const auto& component : directory) {
        partial /= component;
        if (mkdir(partial.c_str(), mode) == 0) {
            // The process umask would otherwise narrow the mode asked for.
            chmod(partial.c_str(), mode);
            continue;
        }
        if (errno != EEXIST)
            return errnoText(errno);
        struct stat status {};
        if (stat(partial.c_str(), &status) != 0 || !S_ISDIR(status.st_mode))
            return partial.string() + " exists and is not a directory";
    }
    return std::nullopt;
}

std::optional<std::string> PosixFileSystem::writeAtomically(const std::filesystem::path& file,
                                                            std::string_view contents)
{
    std::string temporary = (file.parent_path() / ("." + file.filename().string() + ".XXXXXX")).string();
    int fd = mkstemp(temporary.data());
    if (fd < 0)
        return errnoText(errno);
    const char* data = contents.data();
    std::size_t left = contents.size();
    while (left > 0) {
        ssize_t written = ::write(fd, data, left);
        if (written < 0 && errno == EINTR)
            continue;
        if (written < 0) {
            std::string reason = errnoText(errno);
            ::close(fd);
            unlink(temporary.c_str());
            return reason;
        }
        data += written;
        left -= std::size_t(written);
    }
    fchmod(fd, 0644);
    bool synced = fsync(fd) == 0;
    ::close(fd);
    if (!synced || rename(temporary.c_str(), file.c_str()) != 0) {
        std::string reason = errnoText(errno);
        unlink(temporary.c_str());
        return reason;
    }
    return std::nullopt;
}

} // namespace mx
