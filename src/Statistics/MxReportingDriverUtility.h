#pragma once
// The driver statistics sampler: subscribes once, when made, to the channels of four
// audio drivers; takes a snapshot of them when a session starts and gives their
// growth since a snapshot when it stops. A driver whose channels cannot be found is
// never sampled, and a driver that fails later fails alone. Owned by the service
// root; its calls are synchronous and keep no state but the subscriptions, made once
// and only read afterwards, so any queue may call them.

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/MxReportingDriver.h"
#include "platform/Chanstat.h"
#include "platform/MxLog.h"
#include "value/Value.h"

namespace mx {

// Driver description ("Haptics-Stats") -> that driver's samples at the snapshot.
using MxReportingDriverSnapShot = std::map<std::string, ChanstatChannels>;

// One driver's live subscription: the library's handle and the channels it holds.
struct MxReportingIOChannelSubscription {
    MxReportingDriver driver;
    ChanstatSubscription subscription = 0;
    ChanstatChannels subscribedChannels;
};

class MxReportingDriverUtility {
public:
    // init: subscribes to every driver of the fixed list that has channels.
    explicit MxReportingDriverUtility(Chanstat& chanstat);

    // The "mxrd" scope of every line of the sampler.
    static const MxLogScope* logScope();
    // The drivers it subscribes to, in order.
    static const std::array<MxReportingDriver, 4>& drivers();

    const std::vector<MxReportingIOChannelSubscription>& ioChannelSubscriptions() const
    {
        return ioChannelSubscriptions_;
    }

    // Every subscribed driver's samples now; a driver that cannot be sampled is left out.
    MxReportingDriverSnapShot getSnapShot();
    // Each channel's growth since `snapShot` (its value now where there is none, or
    // the driver is not in it), keyed "<group>_<subgroup>_<channel>", for the
    // channels that grew by at least 1; nothing when none did.
    std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(const MxReportingDriverSnapShot* snapShot);

private:
    Chanstat& chanstat_;
    std::vector<MxReportingIOChannelSubscription> ioChannelSubscriptions_;
};

} // namespace mx
