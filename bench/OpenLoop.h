#pragma once
// An open-loop load: reports sent on one connection at a fixed rate whatever the
// server's replies do, each reply's latency timed from the moment its report was due
// (so a stalled server is charged for the reports that queued behind the stall), and
// what the server spent on them from /proc, counted until a second after the last
// reply so that work left for later (store commits) is included.

#include <cstdint>
#include <filesystem>
#include <map>
#include <string>
#include <sys/types.h>

namespace mx::bench {

// What the threads of one name spent per report.
struct ThreadShare {
    double cpuMicroseconds = 0;
    double switches = 0;
};

struct OpenLoopFigures {
    std::uint64_t sent = 0;
    std::uint64_t answered = 0;
    std::uint64_t errors = 0;
    double p50Microseconds = 0;
    double p99Microseconds = 0;
    double maxMicroseconds = 0;
    double cpuMicrosecondsPerReport = 0;
    double switchesPerReport = 0;
    std::map<std::string, ThreadShare> perReportByThreadName;
};

// Sends `rate` reports a second for `seconds` to `socket`, served by process `server`,
// to the session of `reporterID`, made and started first on the same connection (0: to
// no session, for a server that has none).
OpenLoopFigures runOpenLoop(const std::filesystem::path& socket, pid_t server, double rate, double seconds,
                            std::int64_t reporterID);

} // namespace mx::bench
