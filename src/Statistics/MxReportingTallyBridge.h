#pragma once
// Turns one reporting message into one analytics event named after its category and
// type, with the host application from the reporter's session's user information
// added. Stateless; called on the server queue beside every delivery to a session.

#include "Statistics/MxReportingVocabulary.h"
#include "value/Value.h"

namespace mx {

class MxReportingTallyBridge {
public:
    static void handleEvent(const Dictionary& message, MessageCategory category, MessageType type,
                            const Dictionary& userInfo);
};

} // namespace mx
