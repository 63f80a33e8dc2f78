#pragma once
// The file system under the root ($MXREPORTING_ROOT): directories walked one
// component at a time with openat(O_NOFOLLOW) and made with mkdirat under the process
// umask; files written to a temporary name in the directory descriptor, synced and
// renamed over the target. Thread-safe.

#include <atomic>

#include "platform/FileSystem.h"

namespace mx {

class PosixFileSystem final : public FileSystem {
public:
    std::filesystem::path resolve(const std::string& path) override;
    std::optional<std::string> createDirectories(const std::filesystem::path& directory, mode_t mode) override;
    std::optional<std::string> writeAtomically(const std::filesystem::path& file, std::string_view contents) override;
    std::size_t trimDirectory(const std::filesystem::path& directory, std::size_t maxFiles,
                              std::uint64_t maxBytes) override;

private:
    std::atomic<std::uint64_t> temporaries_{0};
};

} // namespace mx
