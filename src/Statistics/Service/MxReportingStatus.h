#pragma once
// The daemon's status view: what the service counts (clients, sessions started,
// reports taken and their rate) with what each store and exporter says of itself.
// One view serves the "status" request, the metrics file and systemd's status line.

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "value/Value.h"

namespace mx {

class MxReportingServiceDelegate;

class MxReportingStatus {
public:
    // A part's own counters, callable from the server queue.
    using Source = std::function<Dictionary()>;

    explicit MxReportingStatus(std::shared_ptr<MxReportingServiceDelegate> root);

    // Named stores, added before the first snapshot; the exporters' counters by name.
    void addStore(std::string name, Source source);
    void setExporters(Source exporters) { exporters_ = std::move(exporters); }

    // Server queue only: "version", "uptime_seconds", "clients", "sessions_started",
    // "reports_received", "reports_per_second", "stores", "exporters".
    Dictionary snapshot();
    // One line for systemd: "3 clients, 1200 reports (40.0/s), exports behind by 12".
    static std::string summaryLine(const Dictionary& status);

private:
    double reportRate(std::uint64_t reports, std::chrono::steady_clock::time_point now);

    const std::shared_ptr<MxReportingServiceDelegate> root_;
    const std::chrono::steady_clock::time_point started_ = std::chrono::steady_clock::now();
    std::vector<std::pair<std::string, Source>> stores_;
    Source exporters_;
    // The rate is the growth since a sample at least a second old.
    std::chrono::steady_clock::time_point sampled_ = started_;
    std::uint64_t sampledReports_ = 0;
    double rate_ = 0;
};

} // namespace mx
