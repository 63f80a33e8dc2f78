#pragma once
// The ceiling for the load benchmark: a bare msgpack-rpc server on the same kind of
// socket, with one thread like the daemon's request thread, that answers every
// request at once with a nil result and does nothing else.

#include <filesystem>

namespace mx::bench {

// Serves `socketPath` until the process ends. Call in a child process.
[[noreturn]] void runEchoServer(const std::filesystem::path& socketPath);

} // namespace mx::bench
