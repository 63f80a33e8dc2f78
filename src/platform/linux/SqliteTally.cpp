#include "platform/linux/SqliteTally.h"

#include <chrono>
#include <fstream>

#include "platform/JsonValue.h"
#include "platform/MxLog.h"
#include "platform/linux/StoreLimits.h"

namespace mx {

namespace {

std::vector<std::string> readDisabled(const std::filesystem::path& configuration)
{
    std::ifstream stream(configuration);
    if (!stream)
        return {};
    auto json = nlohmann::json::parse(stream, nullptr, /*allow_exceptions=*/false);
    std::vector<std::string> disabled;
    if (json.is_object() && json.contains("disabled") && json["disabled"].is_array()) {
        for (const auto& entry : json["disabled"])
            if (entry.is_string())
                disabled.push_back(entry.get<std::string>());
    } else {
        MXLOG(nullptr, Error, "ignoring {}: expected {{\"disabled\": [names or prefixes]}}", configuration.string());
    }
    return disabled;
}

} // namespace

std::unique_ptr<SqliteTally> SqliteTally::open(const std::filesystem::path& database,
                                               const std::filesystem::path& configuration, const StoreLimit& limit,
                                               std::string& error)
{
    auto store = SqliteStore::open(
        database, {"CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL, name TEXT, payload TEXT)"},
        {"INSERT INTO events(time, name, payload) VALUES(?, ?, ?)"}, eventsRetention(limit), error);
    if (!store)
        return nullptr;
    return std::unique_ptr<SqliteTally>(new SqliteTally(std::move(store), readDisabled(configuration)));
}

SqliteTally::SqliteTally(std::unique_ptr<SqliteStore> store, std::vector<std::string> disabled)
    : store_(std::move(store)), disabled_(std::move(disabled))
{
}

bool SqliteTally::wanted(std::string_view name) const
{
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
