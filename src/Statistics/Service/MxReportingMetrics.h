#pragma once
// The status view as Prometheus text, for a node exporter's textfile collector:
// every counter as an mxreportingd_* series (counters end in _total), the stores and
// exporters as labels. Rewritten whole, by rename, so a reader never sees half; it
// says when it was written, and a clean stop removes it, so that a dashboard never
// shows a stopped daemon's last figures as current.

#include <string>
#include <sys/types.h>

#include "value/Value.h"

namespace mx {

class MxReportingMetrics {
public:
    static constexpr const char* kPath = "var/lib/harmonia/metrics/mxreportingd.prom";
    static constexpr mode_t kDirectoryMode = 0755;
    static constexpr mode_t kFileMode = 0644;

    // `now` in seconds since the epoch.
    static std::string prometheusText(const Dictionary& status, double now);
    // Writes the text to kPath under the root; an error is logged once per run of
    // failures, and the next write tries again. Nothing, once removed.
    static void write(const Dictionary& status);
    // Removes the file for good: the daemon is stopping.
    static void remove();
};

} // namespace mx
