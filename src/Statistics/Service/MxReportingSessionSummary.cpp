#include "Statistics/Service/MxReportingSessionSummary.h"

#include <algorithm>
#include <atomic>
#include <limits>
#include <map>
#include <string_view>
#include <vector>

#include <fmt/format.h>

#include "Statistics/Service/MxReportingSession.h"
#include "platform/FileSystem.h"
#include "platform/MxLog.h"
#include "value/JsonValue.h"
#include "wire/MsgpackText.h"

namespace mx {

namespace {

constexpr const char* kSummaryDirectory = "/var/log/harmonia/reporting";
constexpr mode_t kSummaryFileMode = 0640;
constexpr std::size_t kMaximumHostBytes = 128;

std::atomic<std::size_t> gMaximumFiles{std::numeric_limits<std::size_t>::max()};
std::atomic<std::uint64_t> gMaximumBytes{std::numeric_limits<std::uint64_t>::max()};

const MxLogScope* logScope() { return MxReportingSession::logScope(); }

// "/", control characters and the Unicode direction controls (the marks, embeddings,
// overrides and isolates) each become "_".
std::string withoutUnsafeCharacters(const std::string& text)
{
    static constexpr std::string_view kDirectionControls[] = {"\u061C", "\u200E", "\u200F", "\u202A",
                                                              "\u202B", "\u202C", "\u202D", "\u202E",
                                                              "\u2066", "\u2067", "\u2068", "\u2069"};
    std::string safe;
    safe.reserve(text.size());
    for (std::size_t i = 0; i < text.size();) {
        auto byte = static_cast<unsigned char>(text[i]);
        if (byte == '/' || byte < 0x20 || byte == 0x7f) {
            safe += '_';
            ++i;
            continue;
        }
        std::string_view rest = std::string_view(text).substr(i);
        auto control = std::find_if(std::begin(kDirectionControls), std::end(kDirectionControls),
                                    [&](std::string_view candidate) { return rest.starts_with(candidate); });
        if (control != std::end(kDirectionControls)) {
            safe += '_';
            i += control->size();
            continue;
        }
        safe += text[i++];
    }
    return safe;
}

// The entries as one pretty-printed JSON array, or nothing when it would pass what the
// summary directory may hold: trimming would remove it as soon as it was written.
std::string summaryText(const MxReportingAggregationArray& nested)
{
    std::uint64_t room = gMaximumBytes.load();
    std::string text = "[";
    bool read = true;
    bool fits = true;
    nested.forEachEncoded([&](std::string_view entry) {
        if (!read || !fits)
            return;
        text += text.size() == 1 ? "\n" : ",\n";
        text.append(4, ' ');
        read = appendMsgpackPrettyJson(text, entry, 1);
        fits = text.size() < room;
    });
    if (!read) {
        MXLOG(logScope(), Error, "dataWithJSONObject: {}", "a kept message could not be read");
        return {};
    }
    if (!fits) {
        MXLOG_LIMITED(logScope(), Error, "a summary file would pass the {} bytes the summaries may hold: not written",
                      room);
        return {};
    }
    text += "\n]";
    return text;
}

} // namespace

std::optional<Dictionary> MxReportingSessionSummary::createSummaryEvent(const MxReportingAggregationArray* aggregated,
                                                                        ServiceType serviceType)
{
    if (!aggregated)
        return std::nullopt;
    std::lock_guard lock(aggregated->monitor());
    if (aggregated->empty())
        return std::nullopt;

    // Keys keep the order of their first appearance; values keep message order.
    std::vector<std::pair<std::string, std::string>> collected;
    std::map<std::string, std::size_t, std::less<>> position;
    auto into = [&](std::string_view key) -> std::string& {
        auto found = position.find(key);
        if (found == position.end()) {
            position.emplace(key, collected.size());
            return collected.emplace_back(key, std::string()).second;
        }
        auto& joined = collected[found->second].second;
        joined += ',';
        return joined;
    };
    into("Mx_Session_Summary_Event") += std::to_string(serviceType);
    aggregated->forEachEncoded([&](std::string_view payload) { describeMsgpackEntries(payload, into); });

    Dictionary summary;
    for (auto& [key, joined] : collected)
        summary.set(key, std::move(joined));
    return summary;
}

void MxReportingSessionSummary::setRetention(std::size_t maxFiles, std::uint64_t maxBytes)
{
    gMaximumFiles.store(maxFiles);
    gMaximumBytes.store(maxBytes);
}

std::string MxReportingSessionSummary::summaryFileName(std::time_t now, const Dictionary& userInfo,
                                                       ServiceType serviceType)
{
    std::tm local{};
    localtime_r(&now, &local);
    char date[32];
    std::strftime(date, sizeof(date), "%Y%m%d-%H%M%S%z", &local);

    // Lower case on purpose, unlike the "Unknown" host of the analytics events.
    std::string host = "unknown";
    if (const Value* stored = userInfo.find("HostApplicationDisplayID"))
        host = stored->description();
    // The host is the client's text: it must not name another directory, break a line
    // of a listing, turn the rest of a name around, nor make the name longer than a
    // file name may be.
    host = withoutUnsafeCharacters(host);
    if (host.size() > kMaximumHostBytes)
        host.resize(kMaximumHostBytes);
    return fmt::format("{}-{}-{}-{}.json", date, "harmonia", host, MxReportingServiceTypeName(serviceType));
}

void MxReportingSessionSummary::writeSummaryJson(MxReportingAggregationArray* nested, const Dictionary& userInfo,
                                                 ServiceType serviceType)
{
    if (!MxReportingInternalBuild() || !nested)
        return;
    std::string text;
    {
        std::lock_guard lock(nested->monitor());
        if (nested->empty())
            return;
        nested->insert(0, userInfo);
        text = summaryText(*nested);
    }

    auto& fileSystem = ProcessWide<FileSystem>::get();
    auto directory = fileSystem.resolve(kSummaryDirectory);
    if (auto failure = fileSystem.createDirectories(directory, 0777, FileModes::UmaskFiltered))
        MXLOG(logScope(), Error, "can't create logging directory at {}: {}", directory.string(), *failure);
    if (text.empty())
        return;
    // The file is its owner's and its group's to read, whatever the umask.
    if (auto failure =
            fileSystem.writeAtomically(directory / summaryFileName(std::time(nullptr), userInfo, serviceType), text,
                                       kSummaryFileMode, Durability::Synced)) {
        MXLOG(logScope(), Error, "jsonOutput writeToURL: {}", *failure);
        return;
    }
    if (std::size_t removed = fileSystem.trimDirectory(directory, gMaximumFiles.load(), gMaximumBytes.load()))
        MXLOG_LIMITED(logScope(), Info, "removed the {} oldest summary files beyond the limits", removed);
}

} // namespace mx
