#include "platform/linux/JournalLogSink.h"

#include <cstdlib>
#include <string>
#include <sys/stat.h>
#include <syslog.h>

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

namespace mx {

namespace {

int priority(MxLogLevel level)
{
    switch (level) {
    case MxLogLevel::Debug:
        return LOG_DEBUG;
    case MxLogLevel::Info:
        return LOG_INFO;
    case MxLogLevel::Default:
        return LOG_NOTICE;
    case MxLogLevel::Error:
        return LOG_ERR;
    }
    return LOG_NOTICE;
}

} // namespace

void JournalLogSink::write(const MxLogRecord& record)
{
    const char* subsystem = record.scope ? record.scope->subsystem.c_str() : "";
    const char* scope = record.scope ? record.scope->code.c_str() : "default";
    sd_journal_send("MESSAGE=%s", record.text.c_str(), "PRIORITY=%i", priority(record.level), "MXLOG_SUBSYSTEM=%s",
                    subsystem, "MXLOG_SCOPE=%s", scope, "CODE_FILE=%s", record.file, "CODE_LINE=%i", record.line,
                    "CODE_FUNC=%s", record.function.c_str(), nullptr);
}

bool JournalLogSink::runningUnderJournal()
{
    const char* stream = std::getenv("JOURNAL_STREAM");
    if (!stream)
        return false;
    struct stat status {};
    if (fstat(STDERR_FILENO, &status) != 0)
        return false;
    std::string expected = std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
    return expected == stream;
}

} // namespace mx
