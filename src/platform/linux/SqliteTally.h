#pragma once
// The analytics event service on this host: wanted events go to tally.db. Which
// events are wanted comes from etc/harmonia/tally.json ({"disabled": [names or
// prefixes]}); an unwanted event costs a string comparison and its payload is
// never built.

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/Tally.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

struct StoreLimit;

class SqliteTally final : public Tally {
public:
    // The names and prefixes that `configuration` disables; none without the file.
    // Nothing, with `errors` added, for a file that is not as above.
    static std::optional<std::vector<std::string>> readDisabled(const std::filesystem::path& configuration,
                                                                std::vector<std::string>& errors);
    static std::unique_ptr<SqliteTally> open(const std::filesystem::path& database, std::vector<std::string> disabled,
                                             const StoreLimit& limit);

    void sendEventLazy(std::string_view name, UniqueFunction<Dictionary()> buildPayload) override;
    bool wanted(std::string_view name) const;
    SqliteStore& store() { return *store_; }

    // A configuration read again: from now on these are wanted and kept.
    void reconfigure(std::vector<std::string> disabled, const StoreLimit& limit);

private:
    SqliteTally(std::unique_ptr<SqliteStore> store, std::vector<std::string> disabled);

    std::unique_ptr<SqliteStore> store_;
    mutable std::mutex disabledMutex_;
    std::vector<std::string> disabled_;
};

} // namespace mx
