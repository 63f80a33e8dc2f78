#pragma once
// The driver channel library over the channel files (wire/ChannelFiles): a query walks
// the directories once; a subscription is the files found then, and sampling reads
// just those files, through descriptors nothing can block on. The first channel that
// cannot be read fails its driver's sample; a file caught being rewritten is read again
// within a time the whole sample shares, so that a sample takes milliseconds however
// its files are written.
// Thread-safe: it holds no state but its directory.

#include <atomic>
#include <filesystem>

#include "platform/Chanstat.h"
#include "wire/ChannelFiles.h"

namespace mx {

class FileChanstat final : public Chanstat {
public:
    explicit FileChanstat(std::filesystem::path directory) : files_(std::move(directory)) {}

    std::optional<ChanstatChannels> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>& subgroup,
                                                        std::optional<ChanstatError>& error) override;
    std::int32_t getChannelCount(const ChanstatChannels& channels) override;
    ChanstatSubscription createSubscription(const ChanstatChannels& channels,
                                            ChanstatChannels& subscribedChannels) override;
    std::optional<ChanstatChannels> createSamples(ChanstatSubscription subscription,
                                                  const ChanstatChannels& subscribedChannels,
                                                  std::optional<ChanstatError>& error) override;
    std::optional<ChanstatChannels> createSamplesDelta(const ChanstatChannels* earlier, const ChanstatChannels& later,
                                                       std::optional<ChanstatError>& error) override;

private:
    const ChannelFiles files_;
    std::atomic<ChanstatSubscription> subscriptions_{0};
};

} // namespace mx
