#pragma once
// Forwards engine-on time reports to the power log as "Tessera_Haptics" events,
// chosen by content alone: a message is logged exactly when it holds "EngineOnTime".
// Stateless; called on the server queue beside every delivery to a session.

#include "Statistics/MxReportingVocabulary.h"
#include "value/Value.h"

namespace mx {

class MxReportingJouleUtility {
public:
    // `category` and `type` play no part; they keep the sinks' calls alike.
    // `userInfo` is the reporter's session's user information, for the host application.
    static void handleEvent(const Dictionary& message, MessageCategory category, MessageType type,
                            const Dictionary& userInfo);
};

} // namespace mx
