#include "platform/linux/SpoolUplinkSession.h"

#include <fmt/format.h>

#include "platform/WorkQueue.h"
#include "platform/linux/SpoolUplink.h"
#include "value/JsonValue.h"

namespace mx {

namespace {

bool containsRealtimeEvents(const Dictionary& sessionInfo)
{
    const Value* realtime = sessionInfo.find(kUplinkSessionInfoContainsRealtimeEvents);
    return realtime && realtime->boolValue();
}

} // namespace

SpoolUplinkSession::SpoolUplinkSession(std::shared_ptr<SpoolUplink> uplink, std::int64_t id, Dictionary sessionInfo,
                                       Dictionary userInfo)
    : uplink_(std::move(uplink)), store_(uplink_->store()), id_(id), realtime_(containsRealtimeEvents(sessionInfo))
{
    store_.submit(
        {SpoolUplink::kInsertSession, {id_, std::move(sessionInfo), std::move(userInfo), secondsSinceEpoch()}});
}

// The spool answers at once however many sessions start: their configuration never
// waits for it.
void SpoolUplinkSession::startConfiguration(UniqueFunction<void(std::optional<std::vector<std::string>>)> completion)
{
    uplink_->discoverBackends([completion = std::move(completion)](std::vector<std::string> backends) mutable {
        if (backends.empty())
            completion(std::nullopt);
        else
            completion(std::move(backends));
    });
}

// A realtime session's message goes to the collectors at once: its row is committed
// within the short window, and its commit wakes the exporters.
SqliteWrite SpoolUplinkSession::messageRow(std::uint16_t category, std::uint16_t type, const Dictionary& payload) const
{
    SqliteWrite row{SpoolUplink::kInsertMessage,
                    {id_, secondsSinceEpoch(), std::int64_t{category}, std::int64_t{type}, payload, nullptr, nullptr}};
    row.soon = realtime_;
    return row;
}

bool SpoolUplinkSession::sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                                     std::optional<UplinkError>&)
{
    store_.submit(messageRow(category, type, payload));
    return true;
}

void SpoolUplinkSession::flushMessages(UniqueFunction<void(std::optional<UplinkError>)> completion)
{
    store_.submit({SpoolUplink::kFlushSession, {secondsSinceEpoch(), id_}});
    ProcessWide<Dispatch>::get()
        .globalQueue(QueuePriority::Utility)
        .dispatch([uplink = uplink_, id = id_, realtime = realtime_, completion = std::move(completion)]() mutable {
            ScopedBlockingCall settling;
            completion(uplink->settleSession(id, realtime));
        });
}

std::string SpoolUplinkSession::description() const { return fmt::format("<spool session {}>", id_); }

} // namespace mx
