#include "platform/MxLog.h"

#include <cstdio>
#include <cstdlib>
#include <map>
#include <memory>
#include <mutex>

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
    std::string function(MxLogFunctionName(signature));
    std::string message = fmt::format("{}:{}:{}: {}", file, line, function, text);
    MxLogRecord record{scope, level, file, line, std::move(function), std::move(message)};
    if (ProcessWide<MxLogSink>::installed())
        ProcessWide<MxLogSink>::get().write(record);
    else
        std::fprintf(stderr, "%s\n", record.message.c_str());
}

} // namespace mx
