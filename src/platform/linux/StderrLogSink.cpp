#include "platform/linux/StderrLogSink.h"

#include <chrono>
#include <cstdio>
#include <ctime>

#include <fmt/format.h>

namespace mx {

namespace {

const char* levelName(MxLogLevel level)
{
    switch (level) {
    case MxLogLevel::Debug:
        return "DEBUG";
    case MxLogLevel::Info:
        return "INFO";
    case MxLogLevel::Default:
        return "NOTICE";
    case MxLogLevel::Error:
        return "ERROR";
    }
    return "NOTICE";
}

// RFC 3339 in local time to the millisecond: 2026-11-23T06:01:02.345+01:00.
std::string timestamp()
{
    auto now = std::chrono::system_clock::now();
    std::time_t seconds = std::chrono::system_clock::to_time_t(now);
    auto milliseconds = std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count() % 1000;
    std::tm local{};
    localtime_r(&seconds, &local);
    char date[32];
    char zone[8];
    std::strftime(date, sizeof date, "%Y-%m-%dT%H:%M:%S", &local);
    std::strftime(zone, sizeof zone, "%z", &local);
    return fmt::format("{}.{:03}{}:{}", date, milliseconds, std::string_view(zone, 3), std::string_view(zone + 3, 2));
}

} // namespace

void StderrLogSink::write(const MxLogRecord& record)
{
    if (record.level == MxLogLevel::Debug && !MxLogEnabled(record.scope, kMxLogVerboseLevel))
        return;
    // One write per line so that lines of different threads never interleave.
    std::string line = fmt::format("{} {} {}\n", timestamp(), levelName(record.level), record.message());
    std::lock_guard lock(mutex_);
    std::fwrite(line.data(), 1, line.size(), stderr);
    std::fflush(stderr);
}

} // namespace mx
