#pragma once
// The real mxreportingd, run as a child process in a private MXREPORTING_ROOT, with
// its stderr in a file the test can wait on and its SQLite stores open to queries.

#include <chrono>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <sys/types.h>
#include <vector>

namespace mx::testing {

class DaemonProcess {
public:
    static constexpr std::chrono::seconds kBound{20};

    DaemonProcess();
    ~DaemonProcess();

    const std::filesystem::path& root() const { return root_; }
    std::filesystem::path path(const std::string& relative) const { return root_ / relative; }
    std::filesystem::path socketPath() const { return path("run/harmonia/reporting.sock"); }
    void writeFile(const std::string& relative, const std::string& contents) const;

    // NAME=VALUE in the daemon's environment from its next start.
    void addEnvironment(std::string entry) { environment_.push_back(std::move(entry)); }
    // Starts the daemon and waits until it accepts connections.
    void start();
    pid_t pid() const { return pid_; }
    // SIGSTOP returns once the daemon has stopped.
    void signal(int signal) const;
    // The exit status, or the signal as 128+N; nothing when it did not end in time.
    std::optional<int> waitForExit();

    // The daemon's resident memory, from /proc.
    std::size_t residentBytes() const;

    std::string log() const;
    bool waitForLog(const std::string& text, std::chrono::milliseconds bound = kBound) const;

    // Every row of a query on one of the stores ("tally", "joule", "uplink"), each
    // column as text.
    std::vector<std::vector<std::string>> query(const std::string& store, const std::string& sql) const;

    // Runs another program with this root in its environment; returns its pid.
    pid_t spawn(const std::vector<std::string>& arguments) const;
    // Runs it to its end with `input` on its stdin: its exit status, and what it
    // printed in `output`.
    int runToEnd(const std::vector<std::string>& arguments, std::string& output, const std::string& input = "") const;

private:
    std::filesystem::path root_;
    pid_t pid_ = -1;
    std::vector<std::string> environment_;
};

// Polls `condition` until it holds or `bound` passes.
bool waitUntil(const std::function<bool()>& condition, std::chrono::milliseconds bound = DaemonProcess::kBound);

} // namespace mx::testing
