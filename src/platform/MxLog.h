#pragma once
// MxLog: the daemon's scoped logging facility. Every diagnostic line goes through a
// registered scope (or the default log) to the one installed MxLogSink: journald
// under systemd, stderr otherwise, a capturing sink in tests. A line is the service's
// text led by the "file:line:function: " of the code that wrote it; the journal keeps
// the location in fields of its own. A line repeated word for word in a burst is let
// through a few times, and one place in the code writes a bounded number of lines a
// window, whatever their texts; the rest is counted. Texts are made printable: what
// a client sends or calls itself never breaks a line or reaches a terminal raw.

#include <cstdint>
#include <string>
#include <string_view>

#include <fmt/format.h>

#include "platform/ProcessWide.h"

namespace mx {

enum class MxLogLevel { Debug, Info, Default, Error };

// A registered scope; lives until the process ends. `verboseLevel` comes from the
// environment variable named after the scope's verbose switch
// (`reporting_server_verbose=5`), read once at registration.
struct MxLogScope {
    std::string code;
    std::string subsystem;
    std::string verboseSwitch;
    int verboseLevel = 0;
};

struct MxLogRecord {
    const MxLogScope* scope = nullptr; // nullptr: the default log
    MxLogLevel level = MxLogLevel::Default;
    const char* file = "";
    int line = 0;
    std::string function; // the enclosing function's name, also for lines written in a lambda
    std::string text;     // what the service wrote, without its location

    // "file:line:function: text".
    std::string message() const { return fmt::format("{}:{}:{}: {}", file, line, function, text); }
};

class MxLogSink {
public:
    virtual ~MxLogSink() = default;
    // Called on whatever thread logs; implementations serialise their own output.
    virtual void write(const MxLogRecord& record) = 0;
};

// Registers the scope `code` once per process and returns it; later calls with the
// same code return the first registration. `kind` and `settings` are the facility's
// registration words, kept for symmetry with other hosts of the facility.
const MxLogScope* MxLogRegisterScope(int kind, std::uint32_t fourCharCode, const std::string& code,
                                     const std::string& subsystem, const std::string& verboseSwitch, int settings);

// Whether `scope` logs at `verboseLevel` (5 is the daemon's verbose level). The
// default log (nullptr) is never verbose.
bool MxLogEnabled(const MxLogScope* scope, int verboseLevel);

// `signature` is the writing function's __PRETTY_FUNCTION__: the prefix names the
// function it declares, or for a lambda the function the lambda is written in.
// `limited`: one of the daemon's own lines, bounded per place.
void MxLogWrite(const MxLogScope* scope, MxLogLevel level, const char* file, int line, std::string_view signature,
                std::string_view text, bool limited = false);

// Forgets every burst counted so far: each test starts with a log nothing held back.
void MxLogResetBurstsForTesting();
// Ends the window of every place now, what was held back still to be said: a test's
// stand-in for the window's time passing.
void MxLogEndBurstWindowsForTesting();

// "start" of "void mx::MxReportingSession::start()", "configure" of the signature of a
// lambda inside configure.
std::string_view MxLogFunctionName(std::string_view signature);

constexpr std::uint32_t MxFourCharCode(const char (&code)[5])
{
    return (std::uint32_t(std::uint8_t(code[0])) << 24) | (std::uint32_t(std::uint8_t(code[1])) << 16) |
        (std::uint32_t(std::uint8_t(code[2])) << 8) | std::uint32_t(std::uint8_t(code[3]));
}

constexpr int kMxLogVerboseLevel = 5;

} // namespace mx

#define MXLOG(scope, level, ...)                                                                                       \
    ::mx::MxLogWrite((scope), ::mx::MxLogLevel::level, __FILE_NAME__, __LINE__, __PRETTY_FUNCTION__,                   \
                     fmt::format(__VA_ARGS__))

// One of the daemon's own lines, which something outside it may repeat at will.
#define MXLOG_LIMITED(scope, level, ...)                                                                               \
    ::mx::MxLogWrite((scope), ::mx::MxLogLevel::level, __FILE_NAME__, __LINE__, __PRETTY_FUNCTION__,                   \
                     fmt::format(__VA_ARGS__), true)

// A debug line written only while the scope's verbose switch is on; the arguments
// are not even formatted otherwise.
#define MXLOG_VERBOSE(scope, ...)                                                                                      \
    do {                                                                                                               \
        if (::mx::MxLogEnabled((scope), ::mx::kMxLogVerboseLevel))                                                     \
            MXLOG((scope), Debug, __VA_ARGS__);                                                                        \
    } while (false)
