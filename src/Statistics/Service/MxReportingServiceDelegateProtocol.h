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
    virtual std::shared_ptr<MxReportingDriverSnapShot> getSnapShot() = 0;
    // Where the drivers' channel files are read: off the server queue, since reading
    // takes as long as there are channels. Nothing when no driver has any (sampling
    // then costs nothing, and is done in place).
    virtual std::shared_ptr<WorkQueue> driverSamplingQueue() = 0;
    virtual std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
        const std::shared_ptr<MxReportingDriverSnapShot>& snapShot) = 0;
    virtual void removeClient(const MxReportingServerInstance& client) = 0;

    // The counters of the status view: a session went from stopped to started, a
    // report was taken (refused ones are not counted).
    virtual void noteSessionStarted() = 0;
    virtual void noteReportReceived() = 0;
};

} // namespace mx
