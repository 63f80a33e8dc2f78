#include "platform/MxLog.h"

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

// Identical error lines: within a window the first few pass and the rest are
// counted; the count rides on the first identical line let through after it. Lines
// that differ (another reporter, another file) are never held back by each other.
class ErrorBursts {
public:
    // Nothing: suppress the line. Else the number suppressed since the last one shown.
    std::optional<std::uint64_t> admit(const MxLogRecord& record)
    {
        auto now = std::chrono::steady_clock::now();
        std::string key = record.message();
        std::lock_guard lock(mutex_);
        if (bursts_.size() >= kMostRemembered)
            forgetQuiet(now);
        auto& burst = bursts_[key];
        if (now - burst.windowStart >= kWindow) {
            burst.windowStart = now;
            burst.shown = 0;
        }
        if (burst.shown >= kLinesPerWindow) {
            ++burst.suppressed;
            return std::nullopt;
        }
        ++burst.shown;
        return std::exchange(burst.suppressed, 0);
    }

private:
    static constexpr std::chrono::seconds kWindow{10};
    static constexpr int kLinesPerWindow = 10;
    static constexpr std::size_t kMostRemembered = 4096;

    struct Burst {
        std::chrono::steady_clock::time_point windowStart;
        int shown = 0;
        std::uint64_t suppressed = 0;
    };

    // Lines whose window is over hold nothing worth keeping but an uncounted tail.
    void forgetQuiet(std::chrono::steady_clock::time_point now)
    {
        std::erase_if(bursts_, [&](const auto& entry) { return now - entry.second.windowStart >= kWindow; });
        if (bursts_.size() >= kMostRemembered)
            bursts_.clear();
    }

    std::mutex mutex_;
    std::map<std::string, Burst> bursts_;
};

ErrorBursts& errorBursts()
{
    static auto* bursts = new ErrorBursts; // outlives every logging thread
    return *bursts;
}

} // namespace

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
    MxLogRecord record{scope, level, file, line, std::string(MxLogFunctionName(signature)), std::string(text)};
    if (level == MxLogLevel::Error) {
        auto suppressed = errorBursts().admit(record);
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
