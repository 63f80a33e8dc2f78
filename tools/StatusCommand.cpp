#include "tools/StatusCommand.h"

#include <cstdio>
#include <iterator>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "tools/MxReportArguments.h"
#include "value/ValueText.h"

namespace mx {

namespace {

using Json = nlohmann::json;

std::string humanBytes(double bytes)
{
    const char* units[] = {"B", "KiB", "MiB", "GiB", "TiB"};
    std::size_t unit = 0;
    while (bytes >= 1024 && unit + 1 < std::size(units))
        bytes /= 1024, ++unit;
    return unit == 0 ? fmt::format("{:.0f} B", bytes) : fmt::format("{:.1f} {}", bytes, units[unit]);
}

std::string humanDuration(double seconds)
{
    auto whole = static_cast<std::int64_t>(seconds);
    if (whole < 60)
        return fmt::format("{:.1f} s", seconds);
    if (whole < 3600)
        return fmt::format("{}m {}s", whole / 60, whole % 60);
    return fmt::format("{}h {}m", whole / 3600, whole % 3600 / 60);
}

// A text of the status as one line of itself: process names, collectors' errors and
// the like come from elsewhere and may hold anything.
std::string printable(const Json& value)
{
    std::string out;
    appendPrintableText(out, value.is_string() ? value.get<std::string>() : value.is_null() ? "" : value.dump());
    return out;
}

double number(const Json& object, const char* key)
{
    auto found = object.find(key);
    return found != object.end() && found->is_number() ? found->get<double>() : 0;
}

long long count(const Json& object, const char* key) { return static_cast<long long>(number(object, key)); }

const Json& member(const Json& object, const char* key)
{
    static const Json nothing;
    auto found = object.find(key);
    return found != object.end() ? *found : nothing;
}

void printStatus(const Json& status)
{
    std::printf("mxreportingd %s, up %s\n", printable(member(status, "version")).c_str(),
                humanDuration(number(status, "uptime_seconds")).c_str());
    const Json& clients = member(status, "clients");
    std::printf("clients: %zu\n", clients.is_array() ? clients.size() : 0);
    for (const auto& client : clients.is_array() ? clients : Json::array()) {
        double backlog = number(client, "backlog_bytes");
        std::string unwritten = backlog > 0 ? ", " + humanBytes(backlog) + " not yet written" : "";
        if (member(client, "held_back") == Json(true))
            unwritten += ", held back until it is";
        std::printf("  pid %lld %s (%lld sessions%s)\n", count(client, "pid"),
                    printable(member(client, "process")).c_str(), count(client, "sessions"), unwritten.c_str());
    }
    std::printf("sessions started: %lld\nreports received: %lld (%.1f/s)\n", count(status, "sessions_started"),
                count(status, "reports_received"), number(status, "reports_per_second"));
    std::printf("stores:\n");
    const Json& stores = member(status, "stores");
    for (const auto& [name, store] : stores.items())
        std::printf("  %-7s %lld rows written, %lld queued, %s on disk, %lld failed writes%s\n",
                    printable(name).c_str(), count(store, "rows_written"), count(store, "queue_depth"),
                    humanBytes(number(store, "bytes")).c_str(), count(store, "failures"),
                    member(store, "pending_rows_in_memory") == Json(true)
                        ? "; rows not yet written are in memory alone (the disk refused their file)"
                        : "");
    const Json& exporters = member(status, "exporters");
    bool any = exporters.is_object() && !exporters.empty();
    std::printf("exporters:%s\n", any ? "" : " none (the spool alone)");
    if (!any)
        return;
    for (const auto& [name, exporter] : exporters.items()) {
        std::string error = printable(member(exporter, "last_error"));
        std::printf("  %s: %lld unacknowledged, oldest %s%s%s\n", printable(name).c_str(),
                    count(exporter, "unacknowledged"), humanDuration(number(exporter, "oldest_seconds")).c_str(),
                    error.empty() ? "" : ", failing: ", error.c_str());
    }
}

} // namespace

std::unique_ptr<MxReportCommand> parseStatusCommand(const Words& words)
{
    if (words[0] != "status")
        return nullptr;
    bool json = words.size() == 2 && words[1] == "--json";
    if (words.size() > 1 && !json)
        throw UsageError{"status takes --json"};
    return std::make_unique<MxReportCommand>(true, [json](MxReportContext& context) {
        std::string text;
        if (int error = context.client->status(text); error < 0)
            return failed("status", error);
        if (json) {
            std::printf("%s\n", text.c_str());
            return kExitDone;
        }
        auto status = Json::parse(text, nullptr, /*allow_exceptions=*/false);
        if (!status.is_object())
            return failed("status", -EPROTO);
        printStatus(status);
        return kExitDone;
    });
}

} // namespace mx
