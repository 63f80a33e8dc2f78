#pragma once
// What a client's endpoint asks of the service root: the cross-client view (every
// client, a session of any client), the reporting switch and defaults, and the
// driver statistics. Plain synchronous calls, made on the server queue.

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/MxReportingDriverUtility.h"
#include "Statistics/MxReportingVocabulary.h"
#include "platform/WorkQueue.h"
#include "value/Value.h"

namespace mx {

class MxReportingServerInstance;
class MxReportingSession;

class MxReportingServiceDelegateProtocol {
public:
    virtual ~MxReportingServiceDelegateProtocol() = default;

    // Nothing until the preferences were first read.
    virtual std::optional<Dictionary> getDefaults() = 0;
    // The connected endpoints in connection order.
    virtual const std::vector<std::shared_ptr<MxReportingServerInstance>>& getAllClients() = 0;
    virtual bool isReportingEnabled() = 0;
    // The first session of that ID in any client; nothing for ID 0 or while reporting is off.
    virtual std::shared_ptr<MxReportingSession> findReportingSessionForID(ReporterID reporterID) = 0;
    // The same lookup without its lines in the log: for what a request looks at before
    // it does anything (the limits it would pass).
    virtual std::shared_ptr<MxReportingSession> lookUpSession(ReporterID reporterID) = 0;
    virtual std::shared_ptr<MxReportingDriverSnapShot> getSnapShot() = 0;
    virtual std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
        const std::shared_ptr<MxReportingDriverSnapShot>& snapShot) = 0;
    virtual void removeClient(const MxReportingServerInstance& client) = 0;

    // What the whole service holds, for its limits: sessions of every client, and the
    // bytes every session's period keeps.
    virtual std::size_t sessionsHeld() = 0;
    virtual std::size_t keptBytesInService() = 0;

    // The counters of the status view: a session went from stopped to started, a
    // report was taken (refused ones are not counted).
    virtual void noteSessionStarted() = 0;
    virtual void noteReportReceived() = 0;
};

} // namespace mx
