#pragma once
// One command of an mxreport chain ("create 5 -- type 5 longformaudio -- start 5"):
// parsed and checked, all of them, before any runs, so that a chain with a bad
// command does nothing at all. The commands that talk to the daemon share the chain's
// one connection, as a session lives as long as the connection that created it.

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <mxreporting/mxreporting.hpp>

namespace mx {

// Exit statuses: done; the daemon refused or failed a command; the daemon cannot be
// reached; bad usage (nothing was done).
inline constexpr int kExitDone = 0;
inline constexpr int kExitRefused = 1;
inline constexpr int kExitUnreachable = 2;
inline constexpr int kExitUsage = 64;

// Thrown while a chain is parsed: the message says what is wrong and how it is used.
struct UsageError {
    std::string message;
};

// What the commands of a chain share while they run.
struct MxReportContext {
    mxr::Client* client = nullptr; // the chain's connection, when one of them needs it
};

class MxReportCommand {
public:
    // `run` returns an exit status (kExitDone to go on with the chain).
    using Run = std::function<int(MxReportContext&)>;

    MxReportCommand(bool usesConnection, Run run) : usesConnection_(usesConnection), run_(std::move(run)) {}

    bool usesConnection() const { return usesConnection_; }
    int run(MxReportContext& context) const { return run_(context); }

private:
    bool usesConnection_;
    Run run_;
};

using Words = std::vector<std::string>;

// A command family's parser: the command `words` name, nothing when it is not one of
// the family's, a UsageError when it is but its arguments are wrong.
using MxReportParser = std::unique_ptr<MxReportCommand> (*)(const Words& words);

} // namespace mx
