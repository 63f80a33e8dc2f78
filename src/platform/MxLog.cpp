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

// Bursts of lines, so that nothing a client sends can fill the log: within a window
// a text repeated word for word passes a few times, and one place in the code writes
// a bounded number of lines whatever their texts (one per datagram of a flood, each
// quoting a different one). What is held back is counted, and the count rides on the
// next line that place writes. Different texts under the bound never hold each other
// back, so one reporter's errors cannot hide another's.
class LogBursts {
public:
    // Nothing: suppress the line. Else the number suppressed at its place since the
    // last line shown from there.
    void reset()
    {
        std::lock_guard lock(mutex_);
        texts_.clear();
        places_.clear();
    }

    std::optional<std::uint64_t> admit(const MxLogRecord& record)
    {
        auto now = std::chrono::steady_clock::now();
        std::string key = record.message();
        std::lock_guard lock(mutex_);
        if (texts_.size() >= kMostRemembered)
            forgetQuiet(texts_, now);
        if (places_.size() >= kMostRemembered)
            forgetQuiet(places_, now);
        auto& place = places_[Place{record.file, record.line}];
        auto& text = texts_[key];
        restartIfOver(place, now);
        restartIfOver(text, now);
        if (place.shown >= kLinesPerPlace || text.shown >= kLinesPerText) {
            ++place.suppressed;
            return std::nullopt;
        }
        ++place.shown;
        ++text.shown;
        return std::exchange(place.suppressed, 0);
    }

private:
    static constexpr std::chrono::seconds kWindow{10};
    static constexpr int kLinesPerText = 10;
    static constexpr int kLinesPerPlace = 100;
    static constexpr std::size_t kMostRemembered = 4096;

    struct Burst {
        std::chrono::steady_clock::time_point windowStart;
        int shown = 0;
        std::uint64_t suppressed = 0;
    };
    using Place = std::pair<std::string, int>;

    static void restartIfOver(Burst& burst, std::chrono::steady_clock::time_point now)
    {
        if (now - burst.windowStart >= kWindow) {
            burst.windowStart = now;
            burst.shown = 0;
        }
    }

    // Bursts whose window is over hold nothing worth keeping but an uncounted tail.
    template <class Map>
    static void forgetQuiet(Map& bursts, std::chrono::steady_clock::time_point now)
    {
        std::erase_if(bursts, [&](const auto& entry) { return now - entry.second.windowStart >= kWindow; });
        if (bursts.size() >= kMostRemembered)
            bursts.clear();
    }

    std::mutex mutex_;
    std::map<std::string, Burst> texts_;
    std::map<Place, Burst> places_;
};

LogBursts& logBursts()
{
    static auto* bursts = new LogBursts; // outlives every logging thread
    return *bursts;
}

} // namespace

void MxLogResetBurstsForTesting() { logBursts().reset(); }

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

void MxLogWrite(const MxLogScope* scope, MxLogLevel level, const char* file, int line, std::string_view signature,
                std::string_view text)
{
    MxLogRecord record{scope, level, file, line, std::string(MxLogFunctionName(signature)), {}};
    // Lines quote what clients send and call themselves: one line, nothing a terminal obeys.
    if (isPrintableText(text))
        record.text = text;
    else
        appendPrintableText(record.text, text);
    // Verbose lines are asked for, and cut by nothing.
    if (level != MxLogLevel::Debug) {
        auto suppressed = logBursts().admit(record);
        if (!suppressed)
            return;
        if (*suppressed > 0)
            record.text += fmt::format(" ({} more like it suppressed)", *suppressed);
    }
    if (ProcessWide<MxLogSink>::installed())
        ProcessWide<MxLogSink>::get().write(record);
    else
        std::fprintf(stderr, "%s\n", record.message().c_str());
}

} // namespace mx
