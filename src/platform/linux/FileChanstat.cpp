#include "platform/linux/FileChanstat.h"

#include <cerrno>
#include <system_error>
#include <unordered_map>

#include "platform/MxLog.h"

namespace mx {

std::optional<ChanstatChannels> FileChanstat::copyChannelsInGroup(const std::optional<std::string>& group,
                                                                  const std::optional<std::string>& subgroup,
                                                                  std::optional<ChanstatError>& error)
{
    int failure = 0;
    auto found = files_.find(group, subgroup, failure);
    if (failure != 0)
        error = ChanstatError{failure};
    if (!found)
        return std::nullopt;
    ChanstatChannels channels;
    channels.reserve(found->size());
    for (auto& file : *found)
        channels.push_back({std::move(file.name), std::move(file.path), 0});
    return channels;
}

std::int32_t FileChanstat::getChannelCount(const ChanstatChannels& channels)
{
    return static_cast<std::int32_t>(channels.size());
}

ChanstatSubscription FileChanstat::createSubscription(const ChanstatChannels& channels,
                                                      ChanstatChannels& subscribedChannels)
{
    subscribedChannels = channels;
    return ++subscriptions_;
}

// The first channel that cannot be read fails its driver's sample, with its errno.
std::optional<ChanstatChannels> FileChanstat::createSamples(ChanstatSubscription,
                                                            const ChanstatChannels& subscribedChannels,
                                                            std::optional<ChanstatError>& error)
{
    auto retryUntil = std::chrono::steady_clock::now() + ChannelFiles::kRereadTime;
    ChanstatChannels samples;
    samples.reserve(subscribedChannels.size());
    for (const auto& channel : subscribedChannels) {
        int failure = 0;
        auto value = ChannelFiles::readValue(channel.path, failure, retryUntil);
        if (!value) {
            MXLOG_LIMITED(nullptr, Error, "channel {} cannot be read, failing its driver's sample: {}", channel.path,
                          failure == EINVAL ? std::string("not a regular file holding one integer")
                                            : std::generic_category().message(failure));
            error = ChanstatError{failure};
            return std::nullopt;
        }
        samples.push_back(channel);
        samples.back().value = *value;
    }
    return samples;
}

// Channels are matched by path: a later channel the earlier sample lacks has no growth
// to give, and fails the delta.
std::optional<ChanstatChannels> FileChanstat::createSamplesDelta(const ChanstatChannels* earlier,
                                                                 const ChanstatChannels& later,
                                                                 std::optional<ChanstatError>& error)
{
    if (!earlier) {
        error = ChanstatError{ENOENT};
        return std::nullopt;
    }
    std::unordered_map<std::string_view, std::int64_t> before;
    before.reserve(earlier->size());
    for (const auto& channel : *earlier)
        before.emplace(channel.path, channel.value);
    ChanstatChannels delta;
    delta.reserve(later.size());
    for (const auto& channel : later) {
        auto found = before.find(channel.path);
        if (found == before.end()) {
            error = ChanstatError{ENOENT};
            return std::nullopt;
        }
        delta.push_back(channel);
        // A counter that wrapped around still gives its growth, without overflow.
        delta.back().value = static_cast<std::int64_t>(static_cast<std::uint64_t>(channel.value) -
                                                       static_cast<std::uint64_t>(found->second));
    }
    return delta;
}

} // namespace mx
