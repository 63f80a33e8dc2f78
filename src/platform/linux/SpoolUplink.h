#pragma once
// The embedded reporting backend: backend sessions and their messages spooled into
// uplink.db as they come, so that nothing a session was given is lost with the
// process. A batch session is complete once its row has a flush time; exporters
// hold its messages until then and send a realtime session's at once. One-shot
// messages carry their own session and user information and belong to no session.
// Thread-safe; completions run on the global utility queue.

#include <atomic>
#include <filesystem>
#include <memory>

#include "platform/Uplink.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

class SpoolUplink final : public Uplink, public std::enable_shared_from_this<SpoolUplink> {
public:
    static std::shared_ptr<SpoolUplink> open(const std::filesystem::path& database, std::string& error);

    UplinkSecureHierarchyToken newSecureHierarchyToken(const UplinkSecureHierarchyToken* parent) override;
    std::shared_ptr<UplinkSession> makeSession(Dictionary sessionInfo, Dictionary userInfo,
                                               std::vector<std::string> frameworksToCheck) override;
    bool sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category, std::uint16_t type,
                        Dictionary payload, std::optional<UplinkError>& error) override;

    SqliteStore& store() { return *store_; }

    enum Statement : std::size_t { kInsertSession, kFlushSession, kInsertMessage };

private:
    explicit SpoolUplink(std::unique_ptr<SqliteStore> store);

    std::unique_ptr<SqliteStore> store_;
    std::atomic<std::int64_t> lastSessionID_;
};

} // namespace mx
