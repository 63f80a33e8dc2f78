#pragma once
// What the daemon's stores hold, for mxreport: recent analytics events, power log
// events, backend sessions and messages, as an aligned table or as JSON lines.

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace mx {

struct MxReportStoreQuery {
    std::string store; // "events", "power", "sessions", "messages"
    std::size_t limit = 20;
    bool json = false;
};

// "events [--limit N] [--json]" and the like; nothing, with `error`, for bad usage.
std::optional<MxReportStoreQuery> parseStoreQuery(const std::vector<std::string>& words, std::string& error);

// Prints the newest rows (oldest first). Returns the exit status.
int printStore(const std::filesystem::path& storeDirectory, const MxReportStoreQuery& query);

} // namespace mx
