#pragma once
// The file system under the root ($MXREPORTING_ROOT): directories walked one
// component at a time with openat(O_NOFOLLOW) and made with mkdirat (and, for an exact
// mode, fchmod on the directory just made); files written to a temporary name in the
// directory descriptor with their mode set on the descriptor, synced and renamed over
// the target. Thread-safe.

#include <atomic>

#include "platform/FileSystem.h"

namespace mx {

class PosixFileSystem final : public FileSystem {
public:
    // The mode of a directory the daemon makes for its sockets or stores: its owner
    // writes, everyone may pass (the metrics below the stores are everyone's to read).
    static constexpr mode_t kDaemonDirectoryMode = 0755;

    std::filesystem::path resolve(const std::string& path) override;
    std::optional<std::string> createDirectories(const std::filesystem::path& directory, mode_t mode,
                                                 FileModes modes) override;
    std::optional<std::string> writeAtomically(const std::filesystem::path& file, std::string_view contents,
                                               mode_t mode, Durability durability) override;
    // The daemon's own directories (its sockets', its stores'): every one it makes is
    // exactly `mode`, whatever the umask. The reason on failure.
    static std::optional<std::string> makeDirectories(const std::filesystem::path& directory, mode_t mode);
    // What an operator needs to mend an access to `path` refused with `error`: " (PATH
    // is owned by OWNER:GROUP, mode 0755; this process runs as USER:GROUP)", or "" for
    // another error or a path that cannot be looked at.
    static std::string refusalHint(int error, const std::filesystem::path& path);
    std::size_t trimDirectory(const std::filesystem::path& directory, std::size_t maxFiles,
                              std::uint64_t maxBytes) override;

private:
    std::atomic<std::uint64_t> temporaries_{0};
};

} // namespace mx
