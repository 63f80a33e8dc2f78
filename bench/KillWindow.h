#pragma once
// How many acknowledged reports a SIGKILL takes with it: reports are sent at a fixed
// rate, the daemon is killed at an unplanned moment, and what its stores hold is
// compared with the replies that said the reports were taken. The window is the time
// between the first acknowledged report missing from a store and the kill.

#include <filesystem>

namespace mx::bench {

struct KillWindowFigures {
    int rounds = 0;
    double longestWindowMilliseconds = 0; // over every round and store
    double meanWindowMilliseconds = 0;    // of each round's longest
    std::uint64_t acknowledged = 0;       // reports answered as taken, in all rounds
    std::uint64_t lost = 0;               // of those, missing from a store after the kill
};

// `rounds` daemons in turn under `root`, each sent `rate` reports a second and killed
// after one to two seconds of it.
KillWindowFigures measureKillWindow(const std::filesystem::path& root, double rate, int rounds);

} // namespace mx::bench
