#pragma once
// The two servers the benchmarks compare: the daemon, run as its own process under a
// private root, and the bare msgpack-rpc echo.

#include <filesystem>
#include <sys/types.h>

namespace mx::bench {

// Starts the daemon under `root`, its log in root/daemon.log. Safe from a process that
// runs threads.
pid_t spawnDaemon(const std::filesystem::path& root);
std::filesystem::path daemonSocket(const std::filesystem::path& root);

// Forks the echo server on `socket`. Call before this process starts any thread.
pid_t forkEcho(const std::filesystem::path& socket);

// Whether a client could connect to `socket` within 20 seconds.
bool waitForSocket(const std::filesystem::path& socket);

// Ends `pid` with `signal` and waits for it.
void endProcess(pid_t pid, int signal);

} // namespace mx::bench
