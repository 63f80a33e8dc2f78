#include "Statistics/MxReportingTallyBridge.h"

#include <fmt/format.h>

#include "Statistics/Service/MxReportingSession.h"
#include "platform/Tally.h"

namespace mx {

void MxReportingTallyBridge::handleEvent(const Dictionary& message, MessageCategory category, MessageType type,
                                         const MxReportingSession& session)
{
    // The event keeps the client's keys as sent (spaces and all), unlike the session's copy.
    Dictionary payload = message;
    Dictionary userInfo = session.userInfo()->snapshot();
    payload.set("HostApplicationDisplayID", MxReportingHostApplicationID(&userInfo));
    std::string name = fmt::format("com.kestrel.harmonia.{}.{}", MxReportingCategoryName(category),
                                   MxReportingMessageTypeName(type));
    TallySendEventLazy(name, [payload = std::move(payload)]() mutable { return std::move(payload); });
}

} // namespace mx
