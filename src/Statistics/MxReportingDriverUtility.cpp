#include "Statistics/MxReportingDriverUtility.h"

#include <array>

namespace mx {

namespace {

std::string text(const std::optional<std::string>& name) { return name.value_or("(null)"); }

} // namespace

const MxLogScope* MxReportingDriverUtility::logScope()
{
    static const MxLogScope* scope =
        MxLogRegisterScope(1, MxFourCharCode("mxrd"), "mxrd", "com.kestrel.harmonia", "reporting_driver_verbose", 31);
    return scope;
}

const std::array<MxReportingDriver, 4>& MxReportingDriverUtility::drivers()
{
    static const std::array<MxReportingDriver, 4> kDrivers = {
        MxReportingDriver{"KestrelAE2MCA", std::nullopt},
        MxReportingDriver{"Speaker", std::nullopt},
        MxReportingDriver{std::nullopt, "MCA"},
        MxReportingDriver{"Haptics", "Stats"},
    };
    return kDrivers;
}

MxReportingDriverUtility::MxReportingDriverUtility(Chanstat& chanstat) : chanstat_(chanstat)
{
    MXLOG(logScope(), Info, "creating driverstats driver utility");
    for (const auto& driver : drivers()) {
        std::optional<ChanstatError> error;
        auto channels = chanstat_.copyChannelsInGroup(driver.groupName(), driver.subGroupName(), error);
        if (error)
            MXLOG(logScope(), Error, "error {} getting channels for driver {}-{}", error->code,
                  text(driver.groupName()), text(driver.subGroupName()));
        if (!channels)
            continue;
        if (chanstat_.getChannelCount(*channels) < 1) {
            MXLOG(logScope(), Info, "couldn't find any channels for driver group {}-{}", text(driver.groupName()),
                  text(driver.subGroupName()));
        } else {
            MxReportingIOChannelSubscription subscription{driver, 0, {}};
            subscription.subscription = chanstat_.createSubscription(*channels, subscription.subscribedChannels);
            ioChannelSubscriptions_.push_back(std::move(subscription));
        }
        // Intended: the doubled word, and the line also for a driver found empty.
        MXLOG(logScope(), Default, "subscribed to group group {}-{}", text(driver.groupName()),
              text(driver.subGroupName()));
    }
}

MxReportingDriverSnapShot MxReportingDriverUtility::getSnapShot()
{
    MxReportingDriverSnapShot snapShot;
    for (const auto& subscription : ioChannelSubscriptions_) {
        std::optional<ChanstatError> error;
        MXLOG(logScope(), Info, "sampling driver {}", subscription.driver.description());
        auto samples = chanstat_.createSamples(subscription.subscription, subscription.subscribedChannels, error);
        if (error)
            MXLOG(logScope(), Error, "ChanstatCreateSamples error {}", error->code);
        else if (samples)
            snapShot[subscription.driver.description()] = std::move(*samples);
    }
    return snapShot;
}

std::optional<Dictionary> MxReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const MxReportingDriverSnapShot* snapShot)
{
    Dictionary statistics;
    for (const auto& subscription : ioChannelSubscriptions_) {
        std::optional<ChanstatError> error;
        MXLOG(logScope(), Info, "getting latest samples");
        auto current = chanstat_.createSamples(subscription.subscription, subscription.subscribedChannels, error);
        MXLOG(logScope(), Info, "done getting latest samples");
        if (error) {
            MXLOG(logScope(), Error, "ChanstatCreateSamples error {}", error->code);
            continue;
        }
        if (!current)
            continue;
        std::optional<ChanstatChannels> delta = current;
        if (snapShot) {
            auto earlier = snapShot->find(subscription.driver.description());
            delta =
                chanstat_.createSamplesDelta(earlier == snapShot->end() ? nullptr : &earlier->second, *current, error);
            if (error) {
                MXLOG(logScope(), Error, "ChanstatCreateSamplesDelta error {}", error->code);
                delta = current;
            }
        }
        if (!delta)
            continue;
        std::string prefix = subscription.driver.keyPrefix();
        for (const auto& channel : *delta)
            if (channel.value >= 1)
                statistics.set(prefix + channel.name.value_or(""), channel.value);
    }
    if (statistics.empty())
        return std::nullopt;
    return statistics;
}

} // namespace mx
