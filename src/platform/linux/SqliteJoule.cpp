#include "platform/linux/SqliteJoule.h"

#include "platform/linux/StoreLimits.h"
#include "value/JsonValue.h"

namespace mx {

std::unique_ptr<SqliteJoule> SqliteJoule::open(const std::filesystem::path& database, const StoreLimit& limit)
{
    auto store = SqliteStore::open(database,
                                   {"CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL, "
                                    "agent INTEGER, name TEXT, payload TEXT)"},
                                   {"INSERT INTO events(time, agent, name, payload) VALUES(?, ?, ?, ?)"},
                                   eventsRetention(limit));
    return std::unique_ptr<SqliteJoule>(new SqliteJoule(std::move(store)));
}

void SqliteJoule::logRegisteredEvent(std::int32_t agent, std::string_view name, Dictionary event, const Dictionary*)
{
    store_->submit({0, {secondsSinceEpoch(), std::int64_t{agent}, std::string(name), std::move(event)}});
}

} // namespace mx
