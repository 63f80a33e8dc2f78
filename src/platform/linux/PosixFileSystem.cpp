#include "platform/linux/PosixFileSystem.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <fmt/format.h>

#include "wire/FileOwnership.h"
#include "wire/RootPath.h"

namespace mx {

namespace {

// strerror shares one buffer between threads; the GNU strerror_r does not.
std::string errnoText(int error)
{
    char buffer[256];
    return strerror_r(error, buffer, sizeof(buffer));
}

bool hasMode(int fd, mode_t mode)
{
    struct stat status {};
    return ::fstat(fd, &status) == 0 && (status.st_mode & 07777) == mode;
}

} // namespace

std::string PosixFileSystem::refusalHint(int error, const std::filesystem::path& path)
{
    if (error != EACCES && error != EPERM && error != EROFS)
        return "";
    std::string ownership = describeOwnership(path, "this process runs as");
    return ownership.empty() ? "" : " (" + ownership + ")";
}

std::filesystem::path PosixFileSystem::resolve(const std::string& path) { return MxReportingPath(path); }

namespace {

// Closes a descriptor when it goes out of scope.
class Descriptor {
public:
    explicit Descriptor(int fd = -1) : fd_(fd) {}
    ~Descriptor()
    {
        if (fd_ >= 0)
            ::close(fd_);
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    Descriptor& operator=(Descriptor&& other) noexcept
    {
        std::swap(fd_, other.fd_);
        return *this;
    }
    int get() const { return fd_; }

private:
    int fd_;
};

// How openDirectory treats a missing component.
enum class Missing { Fail, Create, CreateExactly, CreateExactlyAlways };

// The directory `directory`: the host's root opened as it is, every component below
// it without following a symbolic link, and made with `mode` where missing when asked.
std::optional<std::string> openDirectory(const std::filesystem::path& directory, Missing missing, mode_t mode,
                                         Descriptor& opened)
{
    std::filesystem::path root = MxReportingRoot();
    std::filesystem::path below = directory.lexically_relative(root);
    if (below.empty() || *below.begin() == "..") {
        root = "/";
        below = directory.relative_path();
    }
    Descriptor current(::open(root.c_str(), O_DIRECTORY | O_RDONLY | O_CLOEXEC));
    if (current.get() < 0)
        return root.string() + ": " + errnoText(errno);
    std::filesystem::path walked = root;
    std::filesystem::path target = (root / below).lexically_normal();
    if (target.filename().empty())
        target = target.parent_path();
    for (const auto& component : below) {
        if (component == "." || component.empty())
            continue;
        walked /= component;
        bool made = false;
        if (missing != Missing::Fail) {
            made = mkdirat(current.get(), component.c_str(), mode) == 0;
            if (!made && errno != EEXIST) {
                int error = errno;
                return walked.string() + ": " + errnoText(error) +
                    PosixFileSystem::refusalHint(error, walked.parent_path());
            }
        }
        Descriptor next(openat(current.get(), component.c_str(), O_DIRECTORY | O_NOFOLLOW | O_RDONLY | O_CLOEXEC));
        if (next.get() < 0)
            return walked.string() +
                (errno == ELOOP || errno == ENOTDIR ? " is not a directory" : ": " + errnoText(errno));
        // Set on what was opened, never on a path another could have swapped meanwhile.
        bool last = walked == target;
        bool exact = missing == Missing::CreateExactly || missing == Missing::CreateExactlyAlways;
        if (((made && exact) || (last && missing == Missing::CreateExactlyAlways)) && !hasMode(next.get(), mode) &&
            fchmod(next.get(), mode) != 0)
            return walked.string() + ": " + errnoText(errno);
        current = std::move(next);
    }
    opened = std::move(current);
    return std::nullopt;
}

} // namespace

std::optional<std::string> PosixFileSystem::createDirectories(const std::filesystem::path& directory, mode_t mode,
                                                              FileModes modes)
{
    Descriptor opened;
    Missing missing = modes == FileModes::ExactAlways ? Missing::CreateExactlyAlways
        : modes == FileModes::Exact                   ? Missing::CreateExactly
                                                      : Missing::Create;
    return openDirectory(directory, missing, mode, opened);
}

std::optional<std::string> PosixFileSystem::makeDirectories(const std::filesystem::path& directory, mode_t mode)
{
    Descriptor opened;
    return openDirectory(directory, Missing::CreateExactly, mode, opened);
}

std::optional<std::string> PosixFileSystem::writeAtomically(const std::filesystem::path& file,
                                                            std::string_view contents, mode_t mode,
                                                            Durability durability)
{
    Descriptor directory;
    if (auto failure = openDirectory(file.parent_path(), Missing::Fail, 0, directory))
        return failure;
    std::string name = file.filename().string();
    std::string temporary = fmt::format(".{}.{}.{}", name, getpid(), ++temporaries_);
    Descriptor out(
        openat(directory.get(), temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
    if (out.get() < 0)
        return errnoText(errno);
    if (fchmod(out.get(), mode) != 0) {
        std::string reason = errnoText(errno);
        unlinkat(directory.get(), temporary.c_str(), 0);
        return reason;
    }
    const char* data = contents.data();
    std::size_t left = contents.size();
    while (left > 0) {
        ssize_t written = ::write(out.get(), data, left);
        if (written < 0 && errno == EINTR)
            continue;
        if (written < 0) {
            std::string reason = errnoText(errno);
            unlinkat(directory.get(), temporary.c_str(), 0);
            return reason;
        }
        data += written;
        left -= std::size_t(written);
    }
    bool synced = durability == Durability::Unsynced || fsync(out.get()) == 0;
    if (!synced || renameat(directory.get(), temporary.c_str(), directory.get(), name.c_str()) != 0) {
        std::string reason = errnoText(errno);
        unlinkat(directory.get(), temporary.c_str(), 0);
        return reason;
    }
    if (durability == Durability::Synced)
        fsync(directory.get());
    return std::nullopt;
}

std::size_t PosixFileSystem::trimDirectory(const std::filesystem::path& directory, std::size_t maxFiles,
                                           std::uint64_t maxBytes)
{
    Descriptor opened;
    if (openDirectory(directory, Missing::Fail, 0, opened))
        return 0;
    struct File {
        std::string name;
        std::int64_t modified;
        std::uint64_t bytes;
    };
    std::vector<File> files;
    std::error_code failure;
    for (const auto& entry : std::filesystem::directory_iterator(directory, failure)) {
        struct stat status {};
        std::string name = entry.path().filename().string();
        if (fstatat(opened.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode))
            files.push_back({name, status.st_mtim.tv_sec * 1'000'000'000 + status.st_mtim.tv_nsec,
                             static_cast<std::uint64_t>(status.st_size)});
    }
    std::sort(files.begin(), files.end(), [](const File& a, const File& b) { return a.modified > b.modified; });
    std::uint64_t kept = 0;
    std::size_t removed = 0;
    for (std::size_t i = 0; i < files.size(); ++i) {
        kept += files[i].bytes;
        if ((i < maxFiles && kept <= maxBytes) || unlinkat(opened.get(), files[i].name.c_str(), 0) != 0)
            continue;
        ++removed;
    }
    return removed;
}

} // namespace mx
