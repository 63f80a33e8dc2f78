#pragma once
// How much disk the daemon's stores and summary files may take, from
// etc/harmonia/stores.json: {"tally": {"max_bytes": N, "max_age_days": D}, "joule":
// ..., "uplink": ..., "summaries": {"max_files": N, "max_bytes": N}}. What the file
// leaves out keeps its default. Read at start-up and again on SIGHUP.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/SqliteStore.h"

namespace mx {

struct StoreLimit {
    std::uint64_t maxBytes = 0;
    std::chrono::seconds maxAge{};
};

struct SummaryLimit {
    std::size_t maxFiles = 0;
    std::uint64_t maxBytes = 0;
};

struct StoreLimits {
    // About 320 bytes a report go to tally.db and uplink.db together: the defaults
    // keep some two million reports, or a month of analytics, in under 1 GB.
    StoreLimit tally{std::uint64_t{256} << 20, std::chrono::hours(24 * 30)};
    StoreLimit joule{std::uint64_t{64} << 20, std::chrono::hours(24 * 90)};
    StoreLimit uplink{std::uint64_t{512} << 20, std::chrono::hours(24 * 14)};
    SummaryLimit summaries{500, std::uint64_t{128} << 20};

    // The limits in `file`, the defaults where it is silent or absent; nothing, with
    // `errors` added, for a file that is not as above.
    static std::optional<StoreLimits> read(const std::filesystem::path& file, std::vector<std::string>& errors);
};

// The retention of a store whose rows live in one table `events` with a `time` column.
SqliteRetention eventsRetention(const StoreLimit& limit);

} // namespace mx
