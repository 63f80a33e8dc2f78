#pragma once
// The log sink of a daemon run by systemd: structured journal entries with the
// subsystem, scope, source location and priority as fields of their own.

#include "platform/MxLog.h"

namespace mx {

class JournalLogSink final : public MxLogSink {
public:
    void write(const MxLogRecord& record) override;

    // True when stderr is connected to the journal (systemd sets JOURNAL_STREAM).
    static bool runningUnderJournal();
};

} // namespace mx
