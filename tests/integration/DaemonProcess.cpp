#include "integration/DaemonProcess.h"

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <fstream>
#include <sstream>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

#include <sqlite3.h>

namespace mx::testing {

namespace {

// Everything the child needs is made before fork: the test's other threads may hold
// the allocator's locks, so the child calls nothing but what is async-signal-safe.
pid_t forkExec(const std::filesystem::path& root, const std::vector<std::string>& arguments, const std::string& log,
               int logFlags, const std::string& input = "/dev/null", const std::vector<std::string>& extra = {})
{
    std::vector<std::string> environment;
    for (char** entry = environ; *entry != nullptr; ++entry) {
        std::string_view text(*entry);
        if (!text.starts_with("MXREPORTING_ROOT=") && !text.starts_with("JOURNAL_STREAM=") &&
            !text.starts_with("LISTEN_FDS=") && !text.starts_with("DBUS_SYSTEM_BUS_ADDRESS="))
            environment.emplace_back(text);
    }
    environment.push_back("MXREPORTING_ROOT=" + root.string());
    // Whatever bus the machine has is not the test's: no bus, unless a test brings one.
    bool ownBus = std::any_of(extra.begin(), extra.end(),
                              [](const std::string& text) { return text.starts_with("DBUS_SYSTEM_BUS_ADDRESS="); });
    if (!ownBus)
        environment.push_back("DBUS_SYSTEM_BUS_ADDRESS=unix:path=" + (root / "run/no-system-bus").string());
    environment.insert(environment.end(), extra.begin(), extra.end());
    auto pointers = [](const std::vector<std::string>& strings) {
        std::vector<char*> result;
        result.reserve(strings.size() + 1);
        for (const auto& text : strings)
            result.push_back(const_cast<char*>(text.c_str()));
        result.push_back(nullptr);
        return result;
    };
    std::vector<char*> argv = pointers(arguments);
    std::vector<char*> envp = pointers(environment);
    pid_t child = fork();
    if (child == 0) {
        int fd = ::open(log.c_str(), O_WRONLY | O_CREAT | logFlags, 0644);
        dup2(fd, STDOUT_FILENO);
        dup2(fd, STDERR_FILENO);
        dup2(::open(input.c_str(), O_RDONLY), STDIN_FILENO);
        execve(argv[0], argv.data(), envp.data());
        _exit(127);
    }
    return child;
}

} // namespace

bool waitUntil(const std::function<bool()>& condition, std::chrono::milliseconds bound)
{
    auto deadline = std::chrono::steady_clock::now() + bound;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

DaemonProcess::DaemonProcess()
{
    std::string pattern = (std::filesystem::temp_directory_path() / "mxreporting-test-XXXXXX").string();
    root_ = mkdtemp(pattern.data());
}

DaemonProcess::~DaemonProcess()
{
    if (pid_ > 0) {
        ::kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
}

void DaemonProcess::writeFile(const std::string& relative, const std::string& contents) const
{
    std::filesystem::create_directories(path(relative).parent_path());
    std::ofstream(path(relative)) << contents;
}

pid_t DaemonProcess::spawn(const std::vector<std::string>& arguments) const
{
    return forkExec(root_, arguments, (root_ / "spawned.log").string(), O_APPEND);
}

int DaemonProcess::runToEnd(const std::vector<std::string>& arguments, std::string& output,
                            const std::string& input) const
{
    std::string inputPath = (root_ / "input.txt").string();
    std::ofstream(inputPath) << input;
    int status = 0;
    waitpid(forkExec(root_, arguments, (root_ / "spawned.log").string(), O_TRUNC, inputPath), &status, 0);
    std::ifstream log(root_ / "spawned.log");
    output.assign(std::istreambuf_iterator<char>(log), std::istreambuf_iterator<char>());
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

void DaemonProcess::start()
{
    std::string log = (root_ / "daemon.log").string();
    // Emptied here, not in the child: a restart must not find the last run's banner.
    std::ofstream(log, std::ios::trunc).close();
    pid_ = forkExec(root_, {MXREPORTINGD_PATH}, log, O_TRUNC, "/dev/null", environment_);
    waitForLog("listening on");
}

void DaemonProcess::signal(int signal) const
{
    ::kill(pid_, signal);
    // kill() returns before every thread has stopped: one may still take a request.
    int status = 0;
    if (signal == SIGSTOP)
        waitpid(pid_, &status, WUNTRACED);
}

std::optional<int> DaemonProcess::waitForExit()
{
    int status = 0;
    bool ended = waitUntil([&] { return waitpid(pid_, &status, WNOHANG) == pid_; });
    if (!ended)
        return std::nullopt;
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

std::size_t DaemonProcess::residentBytes() const
{
    std::ifstream status("/proc/" + std::to_string(pid_) + "/status");
    std::string line;
    while (std::getline(status, line))
        if (line.starts_with("VmRSS:"))
            return std::stoull(line.substr(6)) * 1024;
    return 0;
}

std::string DaemonProcess::log() const
{
    std::ifstream stream(root_ / "daemon.log");
    std::stringstream contents;
    contents << stream.rdbuf();
    return contents.str();
}

bool DaemonProcess::waitForLog(const std::string& text, std::chrono::milliseconds bound) const
{
    return waitUntil([&] { return log().find(text) != std::string::npos; }, bound);
}

std::vector<std::vector<std::string>> DaemonProcess::query(const std::string& store, const std::string& sql) const
{
    std::vector<std::vector<std::string>> rows;
    sqlite3* database = nullptr;
    auto file = path("var/lib/harmonia/" + store + ".db");
    if (sqlite3_open_v2(file.c_str(), &database, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        sqlite3_close(database);
        return rows;
    }
    sqlite3_busy_timeout(database, 5000);
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(database, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK) {
        while (sqlite3_step(statement) == SQLITE_ROW) {
            std::vector<std::string> row;
            for (int column = 0; column < sqlite3_column_count(statement); ++column) {
                auto* text = sqlite3_column_text(statement, column);
                row.push_back(text ? reinterpret_cast<const char*>(text) : "NULL");
            }
            rows.push_back(std::move(row));
        }
    }
    sqlite3_finalize(statement);
    sqlite3_close(database);
    return rows;
}

} // namespace mx::testing
