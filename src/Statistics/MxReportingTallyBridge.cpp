#include "Statistics/MxReportingTallyBridge.h"

#include "platform/Tally.h"

namespace mx {

void MxReportingTallyBridge::handleEvent(const Dictionary& message, MessageCategory category, MessageType type,
                                         const Dictionary& userInfo)
{
    std::string name = "com.kestrel.harmonia.";
    name += MxReportingCategoryName(category);
    name += '.';
    name += MxReportingMessageTypeName(type);
    // The payload is the message as the client sent it (spaces in keys and all) with
    // the host set last. It is made when the analytics service asks for it, which may
    // be on its own thread or never; the message is shared, not copied, until then.
    TallySendEventLazy(name, [message, host = MxReportingHostApplicationID(&userInfo)]() {
        Dictionary payload = message;
        payload.set("HostApplicationDisplayID", host);
        return payload;
    });
}

} // namespace mx
