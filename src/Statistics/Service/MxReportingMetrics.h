#pragma once
// The status view as Prometheus text, for a node exporter's textfile collector:
// every counter as an mxreportingd_* series (counters end in _total), the stores and
// exporters as labels. Rewritten whole, by rename, so a reader never sees half.

#include <string>
#include <sys/types.h>

#include "value/Value.h"

namespace mx {

class MxReportingMetrics {
public:
    static constexpr const char* kPath = "var/lib/harmonia/metrics/mxreportingd.prom";
    static constexpr mode_t kDirectoryMode = 0755;
    static constexpr mode_t kFileMode = 0644;

    static std::string prometheusText(const Dictionary& status);
    // Writes the text to kPath under the root; an error is logged once per run of
    // failures, and the next write tries again.
    static void write(const Dictionary& status);
};

} // namespace mx
