#include "Statistics/Service/MxReportingStatus.h"

#include <fmt/format.h>

#include "Statistics/Service/MxReportingServiceDelegate.h"

namespace mx {

namespace {

Dictionary collect(const std::vector<std::pair<std::string, MxReportingStatus::Source>>& parts)
{
    Dictionary all;
    for (const auto& [name, source] : parts)
        all.set(name, source());
    return all;
}

} // namespace

MxReportingStatus::MxReportingStatus(std::shared_ptr<MxReportingServiceDelegate> root) : root_(std::move(root)) {}

void MxReportingStatus::addStore(std::string name, Source source)
{
    stores_.emplace_back(std::move(name), std::move(source));
}

Dictionary MxReportingStatus::snapshot()
{
    auto now = std::chrono::steady_clock::now();
    std::uint64_t reports = root_->reportsReceived();
    return Dictionary{
        {"version", MXREPORTING_VERSION},    {"uptime_seconds", std::chrono::duration<double>(now - started_).count()},
        {"clients", root_->clientsStatus()}, {"sessions_started", root_->sessionsStarted()},
        {"reports_received", reports},       {"reports_per_second", reportRate(reports, now)},
        {"stores", collect(stores_)},        {"exporters", exporters_ ? exporters_() : Dictionary{}}};
}

double MxReportingStatus::reportRate(std::uint64_t reports, std::chrono::steady_clock::time_point now)
{
    auto elapsed = std::chrono::duration<double>(now - sampled_).count();
    if (elapsed >= 1.0) {
        rate_ = static_cast<double>(reports - sampledReports_) / elapsed;
        sampled_ = now;
        sampledReports_ = reports;
    }
    return rate_;
}

std::string MxReportingStatus::summaryLine(const Dictionary& status)
{
    auto number = [&](const char* key) {
        const Value* value = status.find(key);
        return value ? value->doubleValue() : 0.0;
    };
    const Value* clients = status.find("clients");
    std::size_t clientCount = clients && clients->asArray() ? clients->asArray()->size() : 0;
    std::string line = fmt::format("{} clients, {} reports ({:.1f}/s)", clientCount, number("reports_received"),
                                   number("reports_per_second"));
    double behind = 0;
    if (const Value* exporters = status.find("exporters"); exporters && exporters->asDictionary())
        for (const auto& [name, exporter] : *exporters->asDictionary())
            if (const Dictionary* counters = exporter.asDictionary(); counters && counters->find("unacknowledged"))
                behind += counters->find("unacknowledged")->doubleValue();
    if (behind > 0)
        line += fmt::format(", exports behind by {}", behind);
    return line;
}

} // namespace mx
