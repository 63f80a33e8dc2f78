#pragma once
// Driver channels the test sets by hand: channels per (group, subgroup) query, their
// current values, and errors to give for a query or for sampling a group.

#include <map>
#include <optional>
#include <string>

#include "platform/Chanstat.h"

namespace mx::testing {

class FakeChanstat final : public Chanstat {
public:
    using Query = std::pair<std::optional<std::string>, std::optional<std::string>>;

    std::optional<ChanstatChannels> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>& subgroup,
                                                        std::optional<ChanstatError>& error) override
    {
        if (auto failure = queryErrors.find({group, subgroup}); failure != queryErrors.end())
            error = ChanstatError{failure->second};
        auto found = groups.find({group, subgroup});
        return found == groups.end() ? std::nullopt : std::optional<ChanstatChannels>(found->second);
    }
    std::int32_t getChannelCount(const ChanstatChannels& channels) override { return std::int32_t(channels.size()); }
    ChanstatSubscription createSubscription(const ChanstatChannels& channels, ChanstatChannels& subscribed) override
    {
        subscribed = channels;
        return 1;
    }
    std::optional<ChanstatChannels> createSamples(ChanstatSubscription, const ChanstatChannels& subscribed,
                                                  std::optional<ChanstatError>& error) override
    {
        ChanstatChannels samples = subscribed;
        for (auto& channel : samples) {
            if (failingPaths.count(channel.path)) {
                error = ChanstatError{2};
                return std::nullopt;
            }
            channel.value = values[channel.path];
        }
        return samples;
    }
    std::optional<ChanstatChannels> createSamplesDelta(const ChanstatChannels* earlier, const ChanstatChannels& later,
                                                       std::optional<ChanstatError>& error) override
    {
        if (!earlier) {
            error = ChanstatError{2};
            return std::nullopt;
        }
        ChanstatChannels delta = later;
        for (std::size_t i = 0; i < delta.size() && i < earlier->size(); ++i)
            delta[i].value -= (*earlier)[i].value;
        return delta;
    }

    std::map<Query, ChanstatChannels> groups;
    std::map<Query, int> queryErrors;
    std::map<std::string, std::int64_t> values; // by channel path
    std::map<std::string, bool> failingPaths;
};

} // namespace mx::testing
