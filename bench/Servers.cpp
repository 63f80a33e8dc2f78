#include "Servers.h"

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <spawn.h>
#include <string>
#include <sys/wait.h>
#include <system_error>
#include <thread>
#include <unistd.h>
#include <vector>

#include <mxreporting/mxreporting.hpp>

#include "EchoServer.h"

namespace mx::bench {

pid_t spawnDaemon(const std::filesystem::path& root)
{
    std::vector<std::string> environment = {"MXREPORTING_ROOT=" + root.string()};
    // PATH, and MALLOC_CONF so the daemon's heap can be profiled under load.
    for (const char* name : {"PATH", "MALLOC_CONF"})
        if (const char* value = std::getenv(name))
            environment.push_back(std::string(name) + "=" + value);
    std::vector<char*> pointers;
    pointers.reserve(environment.size() + 1);
    for (auto& entry : environment)
        pointers.push_back(entry.data());
    pointers.push_back(nullptr);
    std::string log = (root / "daemon.log").string();
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    // Another build of the daemon, to compare with: MXREPORTING_BENCH_DAEMON.
    const char* other = std::getenv("MXREPORTING_BENCH_DAEMON");
    std::string program = other ? other : MXREPORTINGD_PATH;
    char* arguments[] = {program.data(), nullptr};
    pid_t pid = 0;
    int failed = posix_spawn(&pid, program.c_str(), &actions, nullptr, arguments, pointers.data());
    posix_spawn_file_actions_destroy(&actions);
    if (failed != 0)
        throw std::system_error(failed, std::generic_category(), "cannot start " + program);
    return pid;
}

std::filesystem::path daemonSocket(const std::filesystem::path& root) { return root / "run/harmonia/reporting.sock"; }

pid_t forkEcho(const std::filesystem::path& socket)
{
    pid_t pid = fork();
    if (pid == 0)
        runEchoServer(socket);
    return pid;
}

bool waitForSocket(const std::filesystem::path& socket)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (std::chrono::steady_clock::now() < deadline) {
        if (mxr::Client(socket.c_str()).open())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

void endProcess(pid_t pid, int signal)
{
    ::kill(pid, signal);
    waitpid(pid, nullptr, 0);
}

} // namespace mx::bench
