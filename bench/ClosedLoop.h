#pragma once
// Closed-loop loads: every connection keeps a number of reports in flight and sends
// the next as soon as one is answered, the throughput ceiling of a server; and one
// client that waits for each reply beside one that floods.

#include <cstdint>
#include <filesystem>
#include <sys/types.h>

namespace mx::bench {

struct ClosedLoopFigures {
    double reportsPerSecond = 0;
    double p50Microseconds = 0;
    double p95Microseconds = 0;
    double p99Microseconds = 0;
    double maxMicroseconds = 0;
    std::uint64_t answered = 0;
    std::uint64_t errors = 0;
};

// `connections` clients with `inFlight` reports outstanding each for `seconds`, each
// to a started session of its own when `withSessions`.
ClosedLoopFigures driveClosedLoop(const std::filesystem::path& socket, int connections, int inFlight, double seconds,
                                  bool withSessions);

// One client floods with `inFlight` outstanding while another sends one report every
// 10 ms and waits for each reply: the other's round trips.
ClosedLoopFigures driveBesideAFlood(const std::filesystem::path& socket, int inFlight, double seconds);

// Whether every store of the daemon on `socket` has written what it was handed.
bool storesIdle(const std::filesystem::path& socket);
void waitUntilStoresIdle(const std::filesystem::path& socket);

// One started session is sent `reports` reports and keeps them all until its stop:
// the daemon's growth per report against the report's size on the wire, and how far
// its memory comes back once the session is gone. Prints what it finds.
void measureKeptMemory(const std::filesystem::path& socket, pid_t daemon, int reports);

// One started session is sent reports of a million small numbers until it keeps all
// it may; the seconds its stop takes, the summary built on the server queue.
double measureFullStop(const std::filesystem::path& socket, int& kept);

} // namespace mx::bench
