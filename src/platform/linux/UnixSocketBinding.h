#pragma once
// Binding the daemon's Unix sockets at their paths so that no one can come between
// the path appearing and its mode being set: the socket is bound in a private
// directory beside the path, given its mode there, and renamed into place, replacing
// a stale socket left by an earlier run. The directories on the way are made with
// exact modes, whatever the umask.

#include <filesystem>
#include <string>
#include <sys/types.h>

namespace mx {

// The mode of a socket of the daemon: its group (audio) connects, nobody else.
inline constexpr mode_t kSocketMode = 0660;

// Binds the socket `fd` at `path` with exactly `mode`. False, with `error`, when any
// step fails.
bool bindUnixSocketPath(int fd, const std::filesystem::path& path, mode_t mode, std::string& error);

} // namespace mx
