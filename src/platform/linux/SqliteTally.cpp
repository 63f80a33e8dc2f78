#include "platform/linux/SqliteTally.h"

#include <algorithm>
#include <chrono>

#include "platform/MxLog.h"
#include "platform/linux/ConfigFile.h"
#include "platform/linux/StoreLimits.h"
#include "value/JsonValue.h"

namespace mx {

std::optional<std::vector<std::string>> SqliteTally::readDisabled(const std::filesystem::path& configuration,
                                                                  std::vector<std::string>& errors)
{
    ConfigFile file(configuration, errors);
    if (!file.exists())
        return std::vector<std::string>{};
    const nlohmann::json* document = file.document();
    if (!document)
        return std::nullopt;
    if (!document->is_object()) {
        file.fail(ConfigFile::Pointer(), "expected {\"disabled\": [names or prefixes]}");
        return std::nullopt;
    }
    bool good = file.onlyKeys(ConfigFile::Pointer(), {"disabled"});
    std::vector<std::string> disabled;
    auto listed = document->find("disabled");
    if (listed == document->end())
        return good ? std::optional(disabled) : std::nullopt;
    bool strings = listed->is_array() &&
        std::all_of(listed->begin(), listed->end(), [](const auto& entry) { return entry.is_string(); });
    if (!file.expect(strings, ConfigFile::Pointer("/disabled"), "an array of event names or prefixes") || !good)
        return std::nullopt;
    for (const auto& entry : *listed)
        disabled.push_back(entry.get<std::string>());
    return disabled;
}

std::unique_ptr<SqliteTally> SqliteTally::open(const std::filesystem::path& database, std::vector<std::string> disabled,
                                               const StoreLimit& limit)
{
    auto store = SqliteStore::open(
        database, {"CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL, name TEXT, payload TEXT)"},
        {"INSERT INTO events(time, name, payload) VALUES(?, ?, ?)"}, eventsRetention(limit));
    return std::unique_ptr<SqliteTally>(new SqliteTally(std::move(store), std::move(disabled)));
}

SqliteTally::SqliteTally(std::unique_ptr<SqliteStore> store, std::vector<std::string> disabled)
    : store_(std::move(store)), disabled_(std::move(disabled))
{
}

void SqliteTally::reconfigure(std::vector<std::string> disabled, const StoreLimit& limit)
{
    store_->setRetention(eventsRetention(limit));
    std::lock_guard lock(disabledMutex_);
    disabled_.swap(disabled);
}

bool SqliteTally::wanted(std::string_view name) const
{
    std::lock_guard lock(disabledMutex_);
    for (const auto& prefix : disabled_)
        if (name.starts_with(prefix))
            return false;
    return true;
}

void SqliteTally::sendEventLazy(std::string_view name, UniqueFunction<Dictionary()> buildPayload)
{
    if (!wanted(name))
        return;
    // Built on the writer thread when the row is written.
    store_->submit({0,
                    {secondsSinceEpoch(), std::string(name),
                     std::make_shared<UniqueFunction<Dictionary()>>(std::move(buildPayload))}});
}

} // namespace mx
