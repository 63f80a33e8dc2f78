#include "platform/linux/SpoolUplink.h"

#include <random>

#include "platform/JsonValue.h"
#include "platform/linux/SpoolUplinkSession.h"

namespace mx {

std::shared_ptr<SpoolUplink> SpoolUplink::open(const std::filesystem::path& database, std::string& error)
{
    auto store = SqliteStore::open(
        database,
        {"CREATE TABLE IF NOT EXISTS sessions(id INTEGER PRIMARY KEY, session_info TEXT, user_info TEXT, "
         "opened REAL, flushed REAL)",
         "CREATE TABLE IF NOT EXISTS messages(id INTEGER PRIMARY KEY, session INTEGER NULL, time REAL, "
         "category INTEGER, type INTEGER, payload TEXT, session_info TEXT NULL, user_info TEXT NULL)"},
        {"INSERT INTO sessions(id, session_info, user_info, opened) VALUES(?, ?, ?, ?)",
         "UPDATE sessions SET flushed = ? WHERE id = ?",
         "INSERT INTO messages(session, time, category, type, payload, session_info, user_info) "
         "VALUES(?, ?, ?, ?, ?, ?, ?)"},
        error);
    if (!store)
        return nullptr;
    return std::shared_ptr<SpoolUplink>(new SpoolUplink(std::move(store)));
}

SpoolUplink::SpoolUplink(std::unique_ptr<SqliteStore> store)
    : store_(std::move(store)), lastSessionID_(store_->queryInteger("SELECT max(id) FROM sessions"))
{
}

UplinkSecureHierarchyToken SpoolUplink::newSecureHierarchyToken(const UplinkSecureHierarchyToken*)
{
    thread_local std::mt19937_64 generator{std::random_device{}()};
    UplinkSecureHierarchyToken token;
    for (std::size_t i = 0; i < token.uuid.size(); i += 8) {
        std::uint64_t bits = generator();
        for (std::size_t j = 0; j < 8; ++j)
            token.uuid[i + j] = static_cast<std::uint8_t>(bits >> (8 * j));
    }
    token.uuid[6] = (token.uuid[6] & 0x0F) | 0x40; // version 4
    token.uuid[8] = (token.uuid[8] & 0x3F) | 0x80; // RFC 4122 variant
    return token;
}

std::shared_ptr<UplinkSession> SpoolUplink::makeSession(Dictionary sessionInfo, Dictionary userInfo,
                                                        std::vector<std::string>)
{
    // Ids are handed out here, not by SQLite, so that messages can name their session
    // before the session row is committed.
    std::int64_t id = ++lastSessionID_;
    return std::make_shared<SpoolUplinkSession>(*store_, id, std::move(sessionInfo), std::move(userInfo));
}

bool SpoolUplink::sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category,
                                 std::uint16_t type, Dictionary payload, std::optional<UplinkError>&)
{
    store_->submit({kInsertMessage,
                    {nullptr, secondsSinceEpoch(), std::int64_t{category}, std::int64_t{type}, std::move(payload),
                     std::move(sessionInfo), std::move(userInfo)}});
    return true;
}

} // namespace mx
