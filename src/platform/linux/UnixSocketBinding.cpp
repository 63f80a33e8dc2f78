#include "platform/linux/UnixSocketBinding.h"

#include <cerrno>
#include <cstring>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <system_error>
#include <unistd.h>

#include "platform/linux/PosixFileSystem.h"

namespace mx {

namespace {

std::string errnoText(int error) { return std::generic_category().message(error); }

} // namespace

bool bindUnixSocketPath(int fd, const std::filesystem::path& path, mode_t mode, std::string& error)
{
    auto directory = path.parent_path();
    if (auto failure = PosixFileSystem::makeDirectories(directory, PosixFileSystem::kDaemonDirectoryMode)) {
        error = "cannot make " + directory.string() + ": " + *failure;
        return false;
    }
    std::string staging = (directory / ".binding-XXXXXX").string();
    if (!mkdtemp(staging.data())) {
        error = "cannot bind " + path.string() + ": " + errnoText(errno);
        return false;
    }
    std::string staged = (std::filesystem::path(staging) / path.filename()).string();
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    bool fits = staged.size() < sizeof(address.sun_path);
    if (fits)
        std::memcpy(address.sun_path, staged.c_str(), staged.size() + 1);
    // In the staging directory, which is its owner's alone, the path cannot be swapped
    // between the bind and the chmod.
    bool bound = fits && ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0 &&
        ::chmod(staged.c_str(), mode) == 0 && ::rename(staged.c_str(), path.c_str()) == 0;
    int failure = fits ? errno : ENAMETOOLONG;
    ::unlink(staged.c_str());
    ::rmdir(staging.c_str());
    if (!bound) {
        error = "cannot bind " + path.string() + ": " + errnoText(failure);
        return false;
    }
    return true;
}

} // namespace mx
