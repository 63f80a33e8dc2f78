#include "Statistics/Service/MxReportingMetrics.h"

#include <chrono>
#include <filesystem>
#include <mutex>
#include <utility>

#include <fmt/format.h>

#include "platform/FileSystem.h"
#include "platform/MxLog.h"

namespace mx {

namespace {

struct Series {
    const char* key;
    const char* name;
    const char* type;
    const char* help;
};

constexpr Series kService[] = {
    {"uptime_seconds", "mxreportingd_uptime_seconds", "gauge", "Seconds since the daemon started."},
    {"sessions_started", "mxreportingd_sessions_started_total", "counter", "Reporting sessions started."},
    {"reports_received", "mxreportingd_reports_received_total", "counter", "Reports taken from clients."},
    {"reports_per_second", "mxreportingd_reports_per_second", "gauge", "Reports taken a second, lately."},
};

constexpr Series kStore[] = {
    {"rows_written", "mxreportingd_store_rows_written_total", "counter", "Rows committed to the store."},
    {"queue_depth", "mxreportingd_store_queue_depth", "gauge", "Rows waiting for the store's writer."},
    {"bytes", "mxreportingd_store_bytes", "gauge", "Bytes the store takes on disk."},
    {"failures", "mxreportingd_store_failures_total", "counter", "Failed attempts to write to the store."},
    {"pending_rows_in_memory", "mxreportingd_store_pending_rows_in_memory", "gauge",
     "1 while the disk refuses the file of pending rows: a crash would lose the rows not yet committed."},
};

constexpr Series kExporter[] = {
    {"unacknowledged", "mxreportingd_exporter_unacknowledged", "gauge", "Messages due for export, unacknowledged."},
    {"oldest_seconds", "mxreportingd_exporter_oldest_seconds", "gauge", "Age of the oldest unacknowledged message."},
};

std::string labelValue(const std::string& text)
{
    std::string escaped;
    for (char c : text) {
        if (c == '\\' || c == '"')
            escaped += '\\';
        if (c == '\n') {
            escaped += "\\n";
            continue;
        }
        escaped += c;
    }
    return escaped;
}

void header(std::string& out, const Series& series)
{
    out += fmt::format("# HELP {} {}\n# TYPE {} {}\n", series.name, series.help, series.name, series.type);
}

// One series per part ("store" or "exporter" label), for every part that has it.
template <std::size_t N>
void partSeries(std::string& out, const Value* parts, const char* label, const Series (&all)[N])
{
    const Dictionary* byName = parts ? parts->asDictionary() : nullptr;
    if (!byName)
        return;
    for (const auto& series : all) {
        header(out, series);
        for (const auto& [name, counters] : *byName)
            if (const Value* value = counters.asDictionary() ? counters.asDictionary()->find(series.key) : nullptr)
                out += fmt::format("{}{{{}=\"{}\"}} {}\n", series.name, label, labelValue(name), value->doubleValue());
    }
}

} // namespace

std::string MxReportingMetrics::prometheusText(const Dictionary& status, double now)
{
    std::string out;
    const Value* version = status.find("version");
    out += "# HELP mxreportingd_build_info The daemon's version.\n# TYPE mxreportingd_build_info gauge\n";
    out +=
        fmt::format("mxreportingd_build_info{{version=\"{}\"}} 1\n", labelValue(version ? version->description() : ""));
    for (const auto& series : kService)
        if (const Value* value = status.find(series.key)) {
            header(out, series);
            out += fmt::format("{} {}\n", series.name, value->doubleValue());
        }
    const Value* clients = status.find("clients");
    out += "# HELP mxreportingd_clients Connected clients.\n# TYPE mxreportingd_clients gauge\n";
    out += fmt::format("mxreportingd_clients {}\n", clients && clients->asArray() ? clients->asArray()->size() : 0);
    partSeries(out, status.find("stores"), "store", kStore);
    partSeries(out, status.find("exporters"), "exporter", kExporter);
    if (const Value* exporters = status.find("exporters"); exporters && exporters->asDictionary()) {
        out += "# HELP mxreportingd_exporter_failing Whether the last export failed.\n"
               "# TYPE mxreportingd_exporter_failing gauge\n";
        for (const auto& [name, counters] : *exporters->asDictionary()) {
            const Value* error = counters.asDictionary() ? counters.asDictionary()->find("last_error") : nullptr;
            bool failing = error && error->asString() && !error->asString()->empty();
            out +=
                fmt::format("mxreportingd_exporter_failing{{exporter=\"{}\"}} {}\n", labelValue(name), failing ? 1 : 0);
        }
    }
    out += "# HELP mxreportingd_last_update_timestamp_seconds When the daemon wrote this file.\n"
           "# TYPE mxreportingd_last_update_timestamp_seconds gauge\n";
    out += fmt::format("mxreportingd_last_update_timestamp_seconds {:.3f}\n", now);
    return out;
}

namespace {

// Writes and the removal, one at a time: a write that began before the removal must
// not bring the file back.
std::mutex gFileMutex;
bool gRemoved = false;

} // namespace

void MxReportingMetrics::write(const Dictionary& status)
{
    static bool failing = false;
    std::lock_guard lock(gFileMutex);
    if (gRemoved)
        return;
    auto now = std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
    auto& fileSystem = ProcessWide<FileSystem>::get();
    auto path = fileSystem.resolve(kPath);
    // Readable by anyone, whatever the umask: a node exporter reads it as its own user.
    auto failure = fileSystem.createDirectories(path.parent_path(), kDirectoryMode, FileModes::ExactAlways);
    if (!failure)
        failure = fileSystem.writeAtomically(path, prometheusText(status, now), kFileMode, Durability::Unsynced);
    if (failure && !std::exchange(failing, true))
        MXLOG_LIMITED(nullptr, Error, "cannot write the metrics file {}: {}", path.string(), *failure);
    if (!failure && std::exchange(failing, false))
        MXLOG_LIMITED(nullptr, Default, "metrics file {} written again", path.string());
}

void MxReportingMetrics::remove()
{
    std::lock_guard lock(gFileMutex);
    gRemoved = true;
    std::error_code ignored; // never written, or already gone
    std::filesystem::remove(ProcessWide<FileSystem>::get().resolve(kPath), ignored);
}

} // namespace mx
