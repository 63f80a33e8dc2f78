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

void MxLogWrite(const MxLogScope* scope, MxLogLevel level, const char* file, int line, const char* function,
                std::string_view text)
{
    MxLogRecord record{scope, level, file, line, function, fmt::format("{}:{}:{}: {}", file, line, function, text)};
    if (ProcessWide<MxLogSink>::installed())
        ProcessWide<MxLogSink>::get().write(record);
    else
        std::fprintf(stderr, "%s\n", record.message.c_str());
}

} // namespace mx
