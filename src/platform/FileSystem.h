#pragma once
// The file system as the daemon writes to it: fixed platform paths placed under this
// host's root, directories made with the permissions asked for, files replaced
// atomically with theirs. Below the host's root no symbolic link is followed: a link
// planted in place of a directory makes the write fail instead of sending it elsewhere.

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

#include "platform/ProcessWide.h"

namespace mx {

// How a mode asked for is applied to what is made: as the process umask filters it (as
// mkdir does), or exactly, whatever the umask; ExactAlways also gives the directory
// asked for (not its parents) the mode when it was already there, made by an older
// version with another.
enum class FileModes { UmaskFiltered, Exact, ExactAlways };
// Whether a replaced file must survive a power cut once written, or may be lost with
// it (a file rewritten every few seconds anyway: syncing it would wake the disk and
// the writer's thread each time).
enum class Durability { Synced, Unsynced };

class FileSystem {
public:
    virtual ~FileSystem() = default;
    // Where the platform path `path` ("/private/var/...") lives on this host.
    virtual std::filesystem::path resolve(const std::string& path) = 0;
    // Creates `directory` and every missing parent with `mode`; an existing directory
    // is success, and keeps its mode. The reason on failure.
    virtual std::optional<std::string> createDirectories(const std::filesystem::path& directory, mode_t mode,
                                                         FileModes modes) = 0;
    // Replaces `file` with `contents`, exactly `mode`, so that readers see the old file
    // or the new one, never a part. The reason on failure.
    virtual std::optional<std::string> writeAtomically(const std::filesystem::path& file, std::string_view contents,
                                                       mode_t mode, Durability durability) = 0;
    // Removes the oldest files of `directory` (by modification time) until at most
    // `maxFiles` remain, holding at most `maxBytes` together. How many went.
    virtual std::size_t trimDirectory(const std::filesystem::path& directory, std::size_t maxFiles,
                                      std::uint64_t maxBytes) = 0;
};

} // namespace mx
