#pragma once
// Keeps every log record so that a test can assert on exact log text.

#include <mutex>
#include <string>
#include <vector>

#include "platform/MxLog.h"

namespace mx::testing {

struct CapturedLine {
    std::string scope; // "" for the default log
    MxLogLevel level;
    std::string function;
    std::string text; // the message after its "file:line:function: " prefix
    std::string message;
};

class CapturingLogSink final : public MxLogSink {
public:
    CapturingLogSink() { MxLogResetBurstsForTesting(); }
    void write(const MxLogRecord& record) override;

    std::vector<CapturedLine> lines() const;
    // The texts, in order, of every line (optionally only those of one level).
    std::vector<std::string> texts() const;
    std::vector<std::string> texts(MxLogLevel level) const;
    bool contains(const std::string& text) const;
    std::size_t count(const std::string& text) const;
    void clear();

private:
    mutable std::mutex mutex_;
    std::vector<CapturedLine> lines_;
};

} // namespace mx::testing
