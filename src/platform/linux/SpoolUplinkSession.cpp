#include "platform/linux/SpoolUplinkSession.h"

#include <fmt/format.h>

#include "platform/WorkQueue.h"
#include "platform/JsonValue.h"
#include "platform/linux/SpoolUplink.h"

namespace mx {

SpoolUplinkSession::SpoolUplinkSession(SqliteStore& store, std::int64_t id, Dictionary sessionInfo, Dictionary userInfo)
    : store_(store), id_(id)
{
    store_.submit({SpoolUplink::kInsertSession,
                   {id_, std::move(sessionInfo), std::move(userInfo), secondsSinceEpoch()}});
}

void SpoolUplinkSession::startConfiguration(UniqueFunction<void(std::optional<std::vector<std::string>>)> completion)
{
    // The spool is always there to answer.
    ProcessWide<Dispatch>::get().globalQueue(QueuePriority::Utility).dispatch(
        [completion = std::move(completion)]() mutable { completion(std::vector<std::string>{"spool"}); });
}

SqliteWrite SpoolUplinkSession::messageRow(std::uint16_t category, std::uint16_t type, const Dictionary& payload) const
{
    return {SpoolUplink::kInsertMessage,
            {id_, secondsSinceEpoch(), std::int64_t{category}, std::int64_t{type}, payload, nullptr,
             nullptr}};
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
    ProcessWide<Dispatch>::get().globalQueue(QueuePriority::Utility).dispatch(
        [completion = std::move(completion)]() mutable { completion(std::nullopt); });
}

std::string SpoolUplinkSession::description() const { return fmt::format("<spool session {}>", id_); }

} // namespace mx
