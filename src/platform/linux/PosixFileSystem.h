#pragma once
// The file system under the root ($MXREPORTING_ROOT): mkdir and chmod for exact
// directory modes, a temporary file and rename(2) for atomic replacement.

#include "platform/FileSystem.h"

namespace mx {

class PosixFileSystem final : public FileSystem {
public:
    std::filesystem::path resolve(const std::string& path) override;
    std::optional<std::string> createDirectories(const std::filesystem::path& directory, mode_t mode) override;
    std::optional<std::string> writeAtomically(const std::filesystem::path& file, std::string_view contents) override;
};

} // namespace mx
