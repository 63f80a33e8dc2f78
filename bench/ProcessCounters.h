#pragma once
// What a process has cost so far, read from /proc: the CPU time and the context
// switches of all its threads, and its memory.

#include <cstdint>
#include <map>
#include <string>
#include <sys/types.h>

namespace mx::bench {

struct ThreadCounters {
    double cpuSeconds = 0;      // run time, to the nanosecond (schedstat)
    std::uint64_t switches = 0; // voluntary and involuntary context switches
    std::string name;           // of the thread, when it is one

    ThreadCounters& operator+=(const ThreadCounters& other)
    {
        cpuSeconds += other.cpuSeconds;
        switches += other.switches;
        return *this;
    }
};

// A reading holds its threads; a span between two readings (`-`) also holds their sum
// and what the threads of each name cost.
struct ProcessCounters : ThreadCounters {
    std::map<pid_t, ThreadCounters> byThread;
    std::map<std::string, ThreadCounters> byThreadName;

    // The threads living now. A thread that ends takes its share with it: across a
    // span, what a thread living at its end spent since it began, or since it started.
    static ProcessCounters of(pid_t pid);
    ProcessCounters operator-(const ProcessCounters& earlier) const;
};

// A field of /proc/PID/status in KiB ("VmHWM", "VmRSS"), or -1.
long memoryKiB(pid_t pid, const std::string& field);

// Forgets the peak resident size so far: VmHWM starts again from VmRSS.
void resetPeakMemory(pid_t pid);

} // namespace mx::bench
