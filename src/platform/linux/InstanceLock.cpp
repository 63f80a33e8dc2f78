#include "platform/linux/InstanceLock.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/file.h>
#include <system_error>
#include <unistd.h>

#include <fmt/format.h>

#include "platform/linux/PosixFileSystem.h"

namespace mx {

std::unique_ptr<InstanceLock> InstanceLock::acquire(const std::filesystem::path& path, std::string& error)
{
    if (auto failure = PosixFileSystem::makeDirectories(path.parent_path(), PosixFileSystem::kDaemonDirectoryMode)) {
        error = fmt::format("cannot make {}: {}", path.parent_path().string(), *failure);
        return nullptr;
    }
    int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
    if (fd < 0) {
        error = fmt::format("cannot open {}: {}", path.string(), std::generic_category().message(errno));
        return nullptr;
    }
    if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
        char holder[32] = {};
        ssize_t length = pread(fd, holder, sizeof(holder) - 1, 0);
        std::string pid = length > 0 ? std::string(holder, std::size_t(length)) : std::string("unknown");
        while (!pid.empty() && (pid.back() == '\n' || pid.back() == ' '))
            pid.pop_back();
        error = fmt::format("another mxreportingd (pid {}) is running on this root ({} is locked)", pid, path.string());
        ::close(fd);
        return nullptr;
    }
    std::string pid = fmt::format("{}\n", getpid());
    if (ftruncate(fd, 0) != 0 || pwrite(fd, pid.data(), pid.size(), 0) != ssize_t(pid.size())) {
        error = fmt::format("cannot write {}: {}", path.string(), std::generic_category().message(errno));
        ::close(fd);
        return nullptr;
    }
    return std::unique_ptr<InstanceLock>(new InstanceLock(fd));
}

InstanceLock::~InstanceLock() { ::close(fd_); }

} // namespace mx
