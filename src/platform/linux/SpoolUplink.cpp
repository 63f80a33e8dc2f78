#include "platform/linux/SpoolUplink.h"

#include <fstream>
#include <random>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "platform/JsonValue.h"
#include "platform/linux/SpoolUplinkSession.h"
#include "platform/linux/StoreLimits.h"

namespace mx {

namespace {

// Reads uplink.json; false, with `error`, when it is there but unusable.
bool readBackends(const std::filesystem::path& configuration, bool& spoolListed, std::vector<std::string>& collectors,
                  std::string& error)
{
    std::ifstream stream(configuration);
    if (!stream) {
        spoolListed = true;
        return true;
    }
    auto json = nlohmann::json::parse(stream, nullptr, false);
    if (json.is_discarded() || !json.is_object() || !json.contains("backends") || !json["backends"].is_array()) {
        error = configuration.string() + ": expected {\"backends\": [...]}";
        return false;
    }
    spoolListed = false;
    for (const auto& backend : json["backends"]) {
        std::string type = backend.is_object() ? backend.value("type", "") : "";
        if (type == "spool") {
            spoolListed = true;
        } else if (type == "otlp-http" && backend.contains("url") && backend["url"].is_string()) {
            collectors.push_back(backend["url"].get<std::string>());
        } else {
            error = configuration.string() + ": unknown backend " + backend.dump();
            return false;
        }
    }
    return true;
}

constexpr auto kSettleTimeout = std::chrono::seconds(10);

// Spool rows go oldest first, those every collector acknowledged before any other. A
// one-shot or realtime message is acknowledged by a collector whose stream cursor
// passed it, a batch session's message by one that exported its session.
SqliteRetention spoolRetention(const StoreLimit& limit, const std::vector<std::string>& collectors)
{
    std::string acknowledged = "1";
    if (!collectors.empty()) {
        std::string listed;
        for (const auto& url : collectors) {
            std::string quoted = url;
            for (std::size_t at = quoted.find('\''); at != std::string::npos; at = quoted.find('\'', at + 2))
                quoted.insert(at, 1, '\'');
            listed += (listed.empty() ? "'" : ", '") + quoted + "'";
        }
        acknowledged = fmt::format(
            "(CASE WHEN m.session IS NULL OR json_extract(s.session_info, '$.ContainsRealtimeEvents') = 1 "
            "THEN (SELECT count(*) FROM exports e WHERE e.backend IN ({0}) AND e.stream_cursor >= m.id) "
            "ELSE (SELECT count(*) FROM exported_sessions e WHERE e.backend IN ({0}) AND e.session = m.session) "
            "END) = {1}",
            listed, collectors.size());
    }
    auto select = [&](const std::string& condition, const std::string& count) {
        return fmt::format("DELETE FROM messages WHERE id IN (SELECT m.id FROM messages m LEFT JOIN sessions s "
                           "ON s.id = m.session WHERE {} ORDER BY m.id LIMIT {})",
                           condition, count);
    };
    bool collecting = !collectors.empty();
    SqliteRetention retention{limit.maxBytes, limit.maxAge, {}, {}, {}};
    retention.olderThan = {{select("m.time < ?1 AND " + acknowledged, "?2")},
                           {select("m.time < ?1", "?2"), collecting}};
    retention.oldest = {{select(acknowledged, "?1")}, {select("1", "?1"), collecting}};
    retention.tidy = {"DELETE FROM sessions WHERE flushed IS NOT NULL AND id < (SELECT max(id) FROM sessions) "
                      "AND NOT EXISTS (SELECT 1 FROM messages WHERE session = sessions.id)",
                      "DELETE FROM exported_sessions WHERE session NOT IN (SELECT id FROM sessions)"};
    return retention;
}

} // namespace

std::shared_ptr<SpoolUplink> SpoolUplink::open(const std::filesystem::path& database,
                                               const std::filesystem::path& configuration, const StoreLimit& limit,
                                               std::string& error)
{
    bool spoolListed = false;
    std::vector<std::string> collectors;
    if (!readBackends(configuration, spoolListed, collectors, error))
        return nullptr;
    auto store = SqliteStore::open(
        database,
        {"CREATE TABLE IF NOT EXISTS sessions(id INTEGER PRIMARY KEY, session_info TEXT, user_info TEXT, "
         "opened REAL, flushed REAL)",
         "CREATE TABLE IF NOT EXISTS messages(id INTEGER PRIMARY KEY, session INTEGER NULL, time REAL, "
         "category INTEGER, type INTEGER, payload TEXT, session_info TEXT NULL, user_info TEXT NULL)",
         "CREATE TABLE IF NOT EXISTS exports(backend TEXT PRIMARY KEY, stream_cursor INTEGER)",
         "CREATE TABLE IF NOT EXISTS exported_sessions(backend TEXT, session INTEGER, PRIMARY KEY(backend, session))",
         // The exporters read a batch session's messages by session.
         "CREATE INDEX IF NOT EXISTS messages_by_session ON messages(session)"},
        {"INSERT INTO sessions(id, session_info, user_info, opened) VALUES(?, ?, ?, ?)",
         "UPDATE sessions SET flushed = ? WHERE id = ?",
         "INSERT INTO messages(session, time, category, type, payload, session_info, user_info) "
         "VALUES(?, ?, ?, ?, ?, ?, ?)"},
        spoolRetention(limit, collectors), error);
    if (!store)
        return nullptr;
    return std::shared_ptr<SpoolUplink>(new SpoolUplink(std::move(store), spoolListed, collectors));
}

SpoolUplink::SpoolUplink(std::unique_ptr<SqliteStore> store, bool spoolListed,
                         const std::vector<std::string>& collectors)
    : store_(std::move(store)),
      lastSessionID_(store_->queryInteger("SELECT max(id) FROM sessions")),
      spoolListed_(spoolListed)
{
    for (const auto& url : collectors)
        exporters_.push_back(std::make_unique<OtlpHttpExporter>(store_->path(), url));
}

SpoolUplink::~SpoolUplink() = default;

std::vector<std::string> SpoolUplink::discoverBackends()
{
    std::vector<std::string> answered;
    if (spoolListed_)
        answered.push_back("spool");
    for (auto& exporter : exporters_)
        if (exporter->probe())
            answered.push_back(exporter->url());
    return answered;
}

std::optional<UplinkError> SpoolUplink::settleSession(std::int64_t session, bool realtime)
{
    if (exporters_.empty())
        return std::nullopt;
    // The exporters read the spool: the session's rows must be committed first.
    store_->flush();
    for (auto& exporter : exporters_) {
        auto error = realtime ? exporter->currentError() : exporter->waitForSession(session, kSettleTimeout);
        if (error)
            return error;
    }
    return std::nullopt;
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
    return std::make_shared<SpoolUplinkSession>(shared_from_this(), id, std::move(sessionInfo), std::move(userInfo));
}

bool SpoolUplink::sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category,
                                 std::uint16_t type, Dictionary payload, std::optional<UplinkError>& error)
{
    store_->submit({kInsertMessage,
                    {nullptr, secondsSinceEpoch(), std::int64_t{category}, std::int64_t{type}, std::move(payload),
                     std::move(sessionInfo), std::move(userInfo)}});
    for (auto& exporter : exporters_) {
        exporter->wake();
        // Spooled all the same: the exporter sends it once the collector is back.
        if (auto failing = exporter->currentError()) {
            error = UplinkError{failing->code, failing->description + " (message kept in the spool)"};
            return false;
        }
    }
    return true;
}

} // namespace mx
