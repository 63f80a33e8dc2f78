#pragma once
// The embedded reporting backend: backend sessions and their messages spooled into
// uplink.db as they come, so that nothing a session was given is lost with the
// process. A batch session is complete once its row has a flush time; exporters
// hold its messages until then and send a realtime session's at once. One-shot
// messages carry their own session and user information and belong to no session.
// Backends come from uplink.json: {"backends": [{"type": "spool"},
// {"type": "otlp-http", "url": "http://127.0.0.1:4318/v1/logs", ...}]}; the spool is always
// the store behind them, so a collector that is down loses nothing.
// Thread-safe; completions run on the global utility queue.

#include <atomic>
#include <filesystem>
#include <memory>
#include <mutex>

#include "platform/Uplink.h"
#include "platform/linux/OtlpCollector.h"
#include "platform/linux/OtlpHttpExporter.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

struct StoreLimit;

class SpoolUplink final : public Uplink, public std::enable_shared_from_this<SpoolUplink> {
public:
    // The backends uplink.json lists: whether the spool is one, and the collectors.
    struct Backends {
        bool spool = true;
        std::vector<OtlpCollector> collectors;
    };
    // The backends of `configuration`; without the file, the spool alone. Nothing,
    // with `errors` added, for a file that lists anything else.
    static std::optional<Backends> readBackends(const std::filesystem::path& configuration,
                                                std::vector<std::string>& errors);

    // The spool at `database`, exporting to the collectors of `backends`.
    static std::shared_ptr<SpoolUplink> open(const std::filesystem::path& database, const Backends& backends,
                                             const StoreLimit& limit);
    ~SpoolUplink() override;

    UplinkSecureHierarchyToken newSecureHierarchyToken(const UplinkSecureHierarchyToken* parent) override;
    std::shared_ptr<UplinkSession> makeSession(Dictionary sessionInfo, Dictionary userInfo,
                                               std::vector<std::string> frameworksToCheck) override;
    bool sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category, std::uint16_t type,
                        Dictionary payload, std::optional<UplinkError>& error) override;

    SqliteStore& store() { return *store_; }
    // The collectors exported to now, and what each says of itself, by URL.
    std::vector<std::shared_ptr<OtlpHttpExporter>> exporters() const;
    Dictionary exportersStatus() const;
    // A configuration read again: the spool listed or not, collectors started and
    // stopped to match, the spool's retention. Callable from any thread.
    void reconfigure(const Backends& backends, const StoreLimit& limit);

    // The backends that answer now, to `found`: "spool" when it is listed, and every
    // collector that answered lately or answers its probe. At once, in place, when no
    // collector needs asking (the spool alone, or collectors heard from lately); else
    // from the global utility queue once the probes are answered. Any thread.
    void discoverBackends(UniqueFunction<void(std::vector<std::string>)> found);
    // Waits (bounded) until the exporters hold the session's messages acknowledged,
    // or for their error; for a realtime session only their current error.
    std::optional<UplinkError> settleSession(std::int64_t session, bool realtime);

    enum Statement : std::size_t { kInsertSession, kFlushSession, kInsertMessage };

private:
    SpoolUplink(std::unique_ptr<SqliteStore> store, bool spoolListed, const std::vector<OtlpCollector>& collectors);

    std::unique_ptr<SqliteStore> store_;
    std::atomic<std::int64_t> lastSessionID_;
    std::atomic<bool> spoolListed_;
    mutable std::mutex exportersMutex_;
    std::vector<std::shared_ptr<OtlpHttpExporter>> exporters_;
};

} // namespace mx
