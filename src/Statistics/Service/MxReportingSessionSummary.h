#pragma once
// What a session leaves behind when it stops: the summary event (every key of the
// period's payloads with all of its values) and, on internal builds, the summary
// file (the user information and every message of the period, as pretty-printed
// JSON). Stateless; runs on the thread that stops the session, taking each
// aggregation array's monitor while it reads that array.

#include <ctime>
#include <optional>
#include <string>

#include "Statistics/MxReportingAggregationArray.h"
#include "Statistics/MxReportingVocabulary.h"
#include "value/Value.h"

namespace mx {

class MxReportingSessionSummary {
public:
    // Every key of the payloads in `aggregated`, with all of its values in text form
    // joined by ","; nothing when nothing was aggregated.
    static std::optional<Dictionary> createSummaryEvent(const MxReportingAggregationArray* aggregated,
                                                        ServiceType serviceType);

    // Puts `userInfo` in front of `nested` (in place: the session drops the array
    // right after) and writes it to the summary directory. Nothing when `nested` is
    // absent or empty, or on a build that is not internal.
    static void writeSummaryJson(MxReportingAggregationArray* nested, const Dictionary& userInfo,
                                 ServiceType serviceType);

    // The most summary files kept, and the most bytes they take together; the oldest
    // go first. Set once at start-up; both unbounded until then.
    static void setRetention(std::size_t maxFiles, std::uint64_t maxBytes);

    // "<local time>-harmonia-<host>-<service type name>.json", the host made safe to
    // stand in one file name.
    static std::string summaryFileName(std::time_t now, const Dictionary& userInfo, ServiceType serviceType);
};

} // namespace mx
