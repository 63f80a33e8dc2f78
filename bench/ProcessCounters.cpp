#include "ProcessCounters.h"

#include <filesystem>
#include <fstream>

namespace mx::bench {

namespace {

std::uint64_t statusNumber(const std::filesystem::path& status, const std::string& field)
{
    std::ifstream file(status);
    std::string line;
    while (std::getline(file, line))
        if (line.rfind(field + ":", 0) == 0)
            return std::stoull(line.substr(field.size() + 1));
    return 0;
}

} // namespace

ProcessCounters ProcessCounters::of(pid_t pid)
{
    ProcessCounters counters;
    std::error_code error;
    for (const auto& task : std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", error)) {
        ThreadCounters thread;
        std::ifstream schedstat(task.path() / "schedstat");
        std::uint64_t runNanoseconds = 0;
        if (schedstat >> runNanoseconds)
            thread.cpuSeconds = static_cast<double>(runNanoseconds) / 1e9;
        thread.switches = statusNumber(task.path() / "status", "voluntary_ctxt_switches") +
            statusNumber(task.path() / "status", "nonvoluntary_ctxt_switches");
        std::string name;
        std::getline(std::ifstream(task.path() / "comm"), name);
        thread.name = name;
        counters.byThread[static_cast<pid_t>(std::stol(task.path().filename().string()))] = thread;
    }
    return counters;
}

ProcessCounters ProcessCounters::operator-(const ProcessCounters& earlier) const
{
    ProcessCounters difference;
    for (auto [id, now] : byThread) {
        auto then = earlier.byThread.find(id);
        if (then != earlier.byThread.end()) {
            now.cpuSeconds -= then->second.cpuSeconds;
            now.switches -= then->second.switches;
        }
        difference += now;
        difference.byThreadName[now.name] += now;
    }
    return difference;
}

long memoryKiB(pid_t pid, const std::string& field)
{
    auto path = std::filesystem::path("/proc") / std::to_string(pid) / "status";
    if (!std::filesystem::exists(path))
        return -1;
    return static_cast<long>(statusNumber(path, field));
}

void resetPeakMemory(pid_t pid)
{
    // 5 written to clear_refs resets the peak resident set size.
    std::ofstream("/proc/" + std::to_string(pid) + "/clear_refs") << "5";
}

} // namespace mx::bench
