#include "platform/linux/SpoolUplink.h"

#include <algorithm>

#include <fmt/format.h>
#include <nlohmann/json.hpp>
#include <systemd/sd-id128.h>

#include "platform/linux/ConfigFile.h"
#include "platform/linux/OtlpCollector.h"
#include "platform/linux/SpoolUplinkSession.h"
#include "platform/linux/StoreLimits.h"
#include "value/JsonValue.h"

namespace mx {

namespace {

constexpr auto kSettleTimeout = std::chrono::seconds(10);

constexpr const char* kSessionsTable = "CREATE TABLE IF NOT EXISTS sessions(id INTEGER PRIMARY KEY, session_info TEXT, "
                                       "user_info TEXT, opened REAL, flushed REAL)";
constexpr const char* kMessagesTable =
    "CREATE TABLE IF NOT EXISTS messages(id INTEGER PRIMARY KEY, session INTEGER NULL, time REAL, category INTEGER, "
    "type INTEGER, payload TEXT, session_info TEXT NULL, user_info TEXT NULL)";

// Spool rows go oldest first, those every collector acknowledged before any other. A
// one-shot or realtime message is acknowledged by a collector whose stream cursor
// passed it, a batch session's message by one that exported its session.
SqliteRetention spoolRetention(const StoreLimit& limit, const std::vector<OtlpCollector>& collectors)
{
    std::string acknowledged = "1";
    if (!collectors.empty()) {
        std::string listed;
        for (const auto& collector : collectors) {
            std::string quoted = collector.url;
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
    SqliteRetention retention{
        limit.maxBytes, limit.maxAge, {}, {}, {}, "SELECT time FROM messages ORDER BY id LIMIT 1"};
    retention.olderThan = {{select("m.time < ?1 AND " + acknowledged, "?2")},
                           {select("m.time < ?1", "?2"), collecting}};
    retention.oldest = {{select(acknowledged, "?1")}, {select("1", "?1"), collecting}};
    retention.tidy = {"DELETE FROM sessions WHERE flushed IS NOT NULL AND id < (SELECT max(id) FROM sessions) "
                      "AND NOT EXISTS (SELECT 1 FROM messages WHERE session = sessions.id)",
                      "DELETE FROM exported_sessions WHERE session NOT IN (SELECT id FROM sessions)"};
    return retention;
}

} // namespace

std::optional<SpoolUplink::Backends> SpoolUplink::readBackends(const std::filesystem::path& configuration,
                                                               std::vector<std::string>& errors)
{
    using Pointer = ConfigFile::Pointer;
    ConfigFile file(configuration, errors);
    if (!file.exists())
        return Backends{true, {}};
    const nlohmann::json* document = file.document();
    if (!document)
        return std::nullopt;
    if (!document->is_object() || !document->contains("backends")) {
        file.fail(Pointer(), "expected {\"backends\": [...]}");
        return std::nullopt;
    }
    bool good = file.onlyKeys(Pointer(), {"backends"});
    const auto& listed = (*document)["backends"];
    if (!file.expect(listed.is_array(), Pointer("/backends"), "an array of backends"))
        return std::nullopt;
    Backends backends{false, {}};
    for (std::size_t index = 0; index < listed.size(); ++index) {
        const auto& backend = listed[index];
        auto at = Pointer("/backends") / index;
        std::string type = backend.is_object() && backend.contains("type") && backend["type"].is_string()
            ? backend["type"].get<std::string>()
            : "";
        if (type == "spool") {
            good &= file.onlyKeys(at, {"type"});
            backends.spool = true;
        } else if (type == "otlp-http") {
            auto collector = OtlpCollector::read(file, at);
            good &= collector.has_value();
            if (!collector)
                continue;
            // Each collector's progress through the spool is kept by its URL.
            if (std::any_of(backends.collectors.begin(), backends.collectors.end(),
                            [&](const auto& listedBefore) { return listedBefore.url == collector->url; })) {
                file.failSetting(at / "url", collector->url + " is listed twice");
                good = false;
            }
            backends.collectors.push_back(std::move(*collector));
        } else {
            file.failSetting(
                at, fmt::format("unknown backend {}: the types are \"spool\" and \"otlp-http\"", backend.dump()));
            good = false;
        }
    }
    if (!good)
        return std::nullopt;
    return backends;
}

std::shared_ptr<SpoolUplink> SpoolUplink::open(const std::filesystem::path& database, const Backends& backends,
                                               const StoreLimit& limit)
{
    const auto& collectors = backends.collectors;
    auto store = SqliteStore::open(
        database,
        {kSessionsTable, kMessagesTable,
         "CREATE TABLE IF NOT EXISTS exports(backend TEXT PRIMARY KEY, stream_cursor INTEGER)",
         "CREATE TABLE IF NOT EXISTS exported_sessions(backend TEXT, session INTEGER, PRIMARY KEY(backend, session))",
         // The exporters read a batch session's messages by session.
         "CREATE INDEX IF NOT EXISTS messages_by_session ON messages(session)"},
        {"INSERT INTO sessions(id, session_info, user_info, opened) VALUES(?, ?, ?, ?)",
         "UPDATE sessions SET flushed = ? WHERE id = ?",
         "INSERT INTO messages(session, time, category, type, payload, session_info, user_info) "
         "VALUES(?, ?, ?, ?, ?, ?, ?)"},
        spoolRetention(limit, collectors));
    return std::shared_ptr<SpoolUplink>(new SpoolUplink(std::move(store), backends.spool, collectors));
}

SpoolUplink::SpoolUplink(std::unique_ptr<SqliteStore> store, bool spoolListed,
                         const std::vector<OtlpCollector>& collectors)
    : store_(std::move(store)),
      lastSessionID_(store_->queryInteger("SELECT max(id) FROM sessions")),
      spoolListed_(spoolListed)
{
    for (const auto& collector : collectors)
        exporters_.push_back(std::make_shared<OtlpHttpExporter>(store_->path(), collector));
    store_->setCommittedSoon([this] {
        for (auto& exporter : exporters())
            exporter->wake();
    });
}

// The store goes first: its writer may wake the exporters until it has stopped.
SpoolUplink::~SpoolUplink() { store_.reset(); }

void SpoolUplink::reconfigure(const Backends& backends, const StoreLimit& limit)
{
    store_->setRetention(spoolRetention(limit, backends.collectors));
    spoolListed_.store(backends.spool);
    std::vector<std::shared_ptr<OtlpHttpExporter>> replaced;
    {
        // One reconfiguration at a time, or two could each start an exporter for one URL.
        std::lock_guard lock(exportersMutex_);
        std::vector<std::shared_ptr<OtlpHttpExporter>> kept;
        for (const auto& collector : backends.collectors) {
            // A collector whose settings changed is reached anew; it goes on from its
            // place in the spool, which is kept by its URL.
            auto found = std::find_if(exporters_.begin(), exporters_.end(),
                                      [&](const auto& exporter) { return exporter->collector() == collector; });
            kept.push_back(found != exporters_.end() ? *found
                                                     : std::make_shared<OtlpHttpExporter>(store_->path(), collector));
        }
        replaced = std::exchange(exporters_, std::move(kept));
    }
    // A collector no longer listed stops, out of the lock, once the last backend
    // thread using it lets go.
}

std::vector<std::shared_ptr<OtlpHttpExporter>> SpoolUplink::exporters() const
{
    std::lock_guard lock(exportersMutex_);
    return exporters_;
}

Dictionary SpoolUplink::exportersStatus() const
{
    Dictionary status;
    for (const auto& exporter : exporters())
        status.set(exporter->url(), exporter->status());
    return status;
}

void SpoolUplink::discoverBackends(UniqueFunction<void(std::vector<std::string>)> found)
{
    // Each backend's answer in its place, so the list keeps the configuration's order.
    struct Discovery {
        std::mutex mutex;
        std::vector<std::optional<std::string>> answered;
        std::size_t asking = 0;
        UniqueFunction<void(std::vector<std::string>)> found;

        void finish()
        {
            std::vector<std::string> backends;
            for (auto& backend : answered)
                if (backend)
                    backends.push_back(std::move(*backend));
            found(std::move(backends));
        }
    };
    auto current = exporters();
    auto discovery = std::make_shared<Discovery>();
    discovery->found = std::move(found);
    discovery->answered.resize(current.size() + 1);
    if (spoolListed_.load())
        discovery->answered[0] = "spool";
    std::vector<std::size_t> unknown;
    for (std::size_t i = 0; i < current.size(); ++i) {
        auto lately = current[i]->answeredLately();
        if (!lately)
            unknown.push_back(i);
        else if (*lately)
            discovery->answered[i + 1] = current[i]->url();
    }
    if (unknown.empty()) {
        discovery->finish();
        return;
    }
    discovery->asking = unknown.size();
    for (std::size_t i : unknown)
        current[i]->probe([discovery, i, url = current[i]->url()](bool answered) {
            std::unique_lock lock(discovery->mutex);
            if (answered)
                discovery->answered[i + 1] = url;
            if (--discovery->asking == 0) {
                lock.unlock();
                discovery->finish();
            }
        });
}

std::optional<UplinkError> SpoolUplink::settleSession(std::int64_t session, bool realtime)
{
    auto current = exporters();
    if (current.empty())
        return std::nullopt;
    // The exporters read the spool: the session's rows must be committed first.
    auto left = store_->flush(std::chrono::steady_clock::now() + kSettleTimeout);
    if (left.kept + left.inMemory > 0)
        return UplinkError{-1, "the spool cannot commit the session's messages now: they wait for it"};
    for (auto& exporter : current) {
        auto error = realtime ? exporter->currentError() : exporter->waitForSession(session, kSettleTimeout);
        if (error)
            return error;
    }
    return std::nullopt;
}

UplinkSecureHierarchyToken SpoolUplink::newSecureHierarchyToken(const UplinkSecureHierarchyToken*)
{
    // A random version 4 UUID from the kernel's generator.
    sd_id128_t id{};
    sd_id128_randomize(&id);
    UplinkSecureHierarchyToken token;
    std::copy(std::begin(id.bytes), std::end(id.bytes), token.uuid.begin());
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
    // Exported at once, as a realtime session's messages are.
    SqliteWrite row{kInsertMessage,
                    {nullptr, secondsSinceEpoch(), std::int64_t{category}, std::int64_t{type}, std::move(payload),
                     std::move(sessionInfo), std::move(userInfo)}};
    row.soon = true;
    store_->submit(std::move(row));
    for (auto& exporter : exporters()) {
        // Spooled all the same: the exporter sends it once the collector is back.
        if (auto failing = exporter->currentError()) {
            error = UplinkError{failing->code, failing->description + " (message kept in the spool)"};
            return false;
        }
    }
    return true;
}

} // namespace mx
