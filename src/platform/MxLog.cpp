#include "platform/MxLog.h"
#include "value/ValueText.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>

namespace mx {

namespace {

struct ScopeRegistry {
    std::mutex mutex;
    std::map<std::string, std::unique_ptr<MxLogScope>> scopes;
};

ScopeRegistry& registry()
{
    static ScopeRegistry* instance = new ScopeRegistry; // outlives every logging thread
    return *instance;
}

int verboseLevelFromEnvironment(const std::string& verboseSwitch)
{
    const char* value = std::getenv(verboseSwitch.c_str());
    if (!value)
        return 0;
    char* end = nullptr;
    long level = std::strtol(value, &end, 10);
    return end != value ? static_cast<int>(level) : 0;
}

// Bursts of the daemon's own lines, so that nothing a client or a file does can fill the
// log: one place in the code writes a bounded number of lines a window, whatever their
// texts (one per datagram of a flood, each quoting a different one). What it held back
// is counted and said, on a line of its own, before the next line it writes.
class LogBursts {
public:
    void reset()
    {
        std::lock_guard lock(mutex_);
        places_.clear();
    }

    void endWindows()
    {
        std::lock_guard lock(mutex_);
        for (auto& [place, burst] : places_)
            burst.windowStart = {};
    }

    // Nothing: hold the line back. Else the number held back at its place since the
    // last line written from there.
    std::optional<std::uint64_t> admit(const MxLogRecord& record)
    {
        auto now = std::chrono::steady_clock::now();
        std::lock_guard lock(mutex_);
        if (places_.size() >= kMostRemembered)
            forgetQuiet(now);
        auto& place = places_[Place{record.file, record.line}];
        if (now - place.windowStart >= kWindow) {
            place.windowStart = now;
            place.shown = 0;
        }
        if (place.shown >= kLinesPerPlace) {
            ++place.heldBack;
            return std::nullopt;
        }
        ++place.shown;
        return std::exchange(place.heldBack, 0);
    }

private:
    static constexpr std::chrono::seconds kWindow{10};
    static constexpr int kLinesPerPlace = 100;
    static constexpr std::size_t kMostRemembered = 4096;

    struct Burst {
        std::chrono::steady_clock::time_point windowStart;
        int shown = 0;
        std::uint64_t heldBack = 0;
    };
    using Place = std::pair<std::string, int>;

    // Places whose window is over hold nothing worth keeping but an uncounted tail.
    void forgetQuiet(std::chrono::steady_clock::time_point now)
    {
        std::erase_if(places_, [&](const auto& entry) { return now - entry.second.windowStart >= kWindow; });
        if (places_.size() >= kMostRemembered)
            places_.clear();
    }

    std::mutex mutex_;
    std::map<Place, Burst> places_;
};

LogBursts& logBursts()
{
    static auto* bursts = new LogBursts; // outlives every logging thread
    return *bursts;
}

} // namespace

void MxLogResetBurstsForTesting() { logBursts().reset(); }

void MxLogEndBurstWindowsForTesting() { logBursts().endWindows(); }

const MxLogScope* MxLogRegisterScope(int /*kind*/, std::uint32_t /*fourCharCode*/, const std::string& code,
                                     const std::string& subsystem, const std::string& verboseSwitch, int /*settings*/)
{
    auto& scopes = registry();
    std::lock_guard lock(scopes.mutex);
    auto& scope = scopes.scopes[code];
    if (!scope)
        scope = std::make_unique<MxLogScope>(
            MxLogScope{code, subsystem, verboseSwitch, verboseLevelFromEnvironment(verboseSwitch)});
    return scope.get();
}

bool MxLogEnabled(const MxLogScope* scope, int verboseLevel) { return scope && scope->verboseLevel >= verboseLevel; }

std::string_view MxLogFunctionName(std::string_view signature)
{
    // A lambda's signature is its enclosing function's followed by the lambda's own
    // part: GCC writes "...::<lambda(...)>", clang "...::(anonymous class)::operator()...".
    for (std::string_view lambda : {"::<lambda", "::(anonymous class)", "::(lambda at"})
        if (auto at = signature.find(lambda); at != std::string_view::npos)
            signature = signature.substr(0, at);
    // A template's signature ends with its arguments: " [with T = int]".
    if (auto with = signature.find(" [with "); with != std::string_view::npos)
        signature = signature.substr(0, with);
    // The name stands before the parameter list, the last balanced "(...)".
    auto close = signature.rfind(')');
    if (close == std::string_view::npos)
        return signature;
    std::size_t depth = 0;
    std::size_t open = close;
    for (std::size_t i = close + 1; i-- > 0;) {
        if (signature[i] == ')')
            ++depth;
        else if (signature[i] == '(' && --depth == 0) {
            open = i;
            break;
        }
    }
    std::string_view qualified = signature.substr(0, open);
    auto start = qualified.find_last_of(": *&");
    return start == std::string_view::npos ? qualified : qualified.substr(start + 1);
}

namespace {

void writeRecord(const MxLogRecord& record)
{
    if (ProcessWide<MxLogSink>::installed())
        ProcessWide<MxLogSink>::get().write(record);
    else
        std::fprintf(stderr, "%s\n", record.message().c_str());
}

} // namespace

void MxLogWrite(const MxLogScope* scope, MxLogLevel level, const char* file, int line, std::string_view signature,
                std::string_view text, bool limited)
{
    MxLogRecord record{scope, level, file, line, std::string(MxLogFunctionName(signature)), {}};
    if (limited) {
        auto heldBack = logBursts().admit(record);
        if (!heldBack)
            return;
        if (*heldBack > 0) {
            MxLogRecord count = record;
            count.text = fmt::format("{} more lines from here were held back", *heldBack);
            writeRecord(count);
        }
    }
    // Lines quote what clients send and call themselves: one line, nothing a terminal obeys.
    if (isPrintableText(text))
        record.text = text;
    else
        appendPrintableText(record.text, text);
    writeRecord(record);
}

} // namespace mx
