#pragma once
// Chanstat: the driver channel statistics library. Drivers publish integer counters
// ("channels") in groups and subgroups; a subscription to a set of channels can be
// sampled, and two samples give a delta (the growth between them). Channels are
// read, never written, by the daemon.

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/ProcessWide.h"

namespace mx {

struct ChanstatError {
    int code = 0; // an errno value
};

struct ChanstatChannel {
    std::optional<std::string> name;
    std::string path; // where the channel lives; the identity used by samples and deltas
    std::int64_t value = 0;
    friend bool operator==(const ChanstatChannel&, const ChanstatChannel&) = default;
};

// A channel set: the result of a group query, a subscription's channels, a sample or
// a delta. Channels are in path order.
using ChanstatChannels = std::vector<ChanstatChannel>;

using ChanstatSubscription = std::uint64_t;

class Chanstat {
public:
    virtual ~Chanstat() = default;
    // The channels of a group and subgroup (an absent name matches every one).
    // Nothing, with `error` set, when the query itself fails.
    virtual std::optional<ChanstatChannels> copyChannelsInGroup(const std::optional<std::string>& group,
                                                                const std::optional<std::string>& subgroup,
                                                                std::optional<ChanstatError>& error) = 0;
    virtual std::int32_t getChannelCount(const ChanstatChannels& channels) = 0;
    virtual ChanstatSubscription createSubscription(const ChanstatChannels& channels,
                                                    ChanstatChannels& subscribedChannels) = 0;
    // Current values of the subscribed channels.
    virtual std::optional<ChanstatChannels> createSamples(ChanstatSubscription subscription,
                                                          const ChanstatChannels& subscribedChannels,
                                                          std::optional<ChanstatError>& error) = 0;
    // later minus earlier, channel by channel.
    virtual std::optional<ChanstatChannels> createSamplesDelta(const ChanstatChannels* earlier,
                                                               const ChanstatChannels& later,
                                                               std::optional<ChanstatError>& error) = 0;
};

} // namespace mx
