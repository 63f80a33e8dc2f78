#include "Statistics/MxReportingJouleUtility.h"

#include "platform/Joule.h"
#include "platform/MxLog.h"

namespace mx {

namespace {
constexpr std::int32_t kJouleAgent = 28;
constexpr const char* kJouleEventName = "Tessera_Haptics";
} // namespace

void MxReportingJouleUtility::handleEvent(const Dictionary& message, MessageCategory, MessageType,
                                          const Dictionary& userInfo)
{
    const Value* engineOnTime = message.find("EngineOnTime");
    if (!engineOnTime)
        return;

    Dictionary event;
    event.set("EngineOnDuration", *engineOnTime);

    Value application = MxReportingHostApplicationID(&userInfo);
    // The lookup falls back to "Unknown"; only a client that configured an explicit
    // null host leaves the event without an application.
    if (!application.isNil())
        event.set("ApplicationName", std::move(application));
    else
        MXLOG(nullptr, Error, "failed to get app name for joule");

    if (const Value* timestamp = message.find("mxreporting_timestamp"))
        event.set("TimestampEnd", *timestamp);
    else
        MXLOG(nullptr, Error, "failed to get MxReporting timestamp for joule");

    JouleLogRegisteredEvent(kJouleAgent, kJouleEventName, std::move(event), nullptr);
}

} // namespace mx
