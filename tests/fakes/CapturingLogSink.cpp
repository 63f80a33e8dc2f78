#include "fakes/CapturingLogSink.h"

#include <algorithm>

namespace mx::testing {

void CapturingLogSink::write(const MxLogRecord& record)
{
    std::lock_guard lock(mutex_);
    lines_.push_back(
        {record.scope ? record.scope->code : "", record.level, record.function, record.text, record.message()});
}

std::vector<CapturedLine> CapturingLogSink::lines() const
{
    std::lock_guard lock(mutex_);
    return lines_;
}

std::vector<std::string> CapturingLogSink::texts() const
{
    std::vector<std::string> texts;
    for (const auto& line : lines())
        texts.push_back(line.text);
    return texts;
}

std::vector<std::string> CapturingLogSink::texts(MxLogLevel level) const
{
    std::vector<std::string> texts;
    for (const auto& line : lines())
        if (line.level == level)
            texts.push_back(line.text);
    return texts;
}

bool CapturingLogSink::contains(const std::string& text) const { return count(text) > 0; }

std::size_t CapturingLogSink::count(const std::string& text) const
{
    auto all = texts();
    return static_cast<std::size_t>(std::count(all.begin(), all.end(), text));
}

void CapturingLogSink::clear()
{
    std::lock_guard lock(mutex_);
    lines_.clear();
}

} // namespace mx::testing
