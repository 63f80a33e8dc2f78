#include "Statistics/MxReportingVocabulary.h"

#include <array>
#include <mutex>

#include "platform/DeviceProperties.h"

namespace mx {

std::string MxReportingServiceTypeName(ServiceType serviceType)
{
    static constexpr std::array<const char*, 13> kNames = {
        "generic",       "assistant",        "telephony",        "haptics", "alarms", "standalone", "soundautoconfig",
        "longformaudio", "nonlongformaudio", "audiodeviceusage", "alerts",  "test",   "apiusage"};
    // Unlisted codes fold into "telephony" on purpose; only the all-ones code is "unknown".
    std::uint32_t code = serviceType;
    if (code == 65535)
        return "unknown";
    if (code > 12)
        return "telephony";
    return kNames[code];
}

std::string MxReportingCategoryName(MessageCategory category)
{
    static constexpr std::array<const char*, 12> kCategories = {
        "Undefined",     "Generic",     "Record", "Playback",    "PlaybackAndRecord", "Setup",
        "ClientRequest", "RouteChange", "Error",  "DriverStats", "Performance",       "Volume"};
    std::string name;
    // The all-ones code is deliberately read as having no subsystem half.
    if (category >= 0x10000 && category != 0xFFFFFFFF) {
        switch (category & 0xFFFF0000) {
        case 0x80000000:
            name = "Toolbox";
            break;
        case 0x08000000:
            name = "Session";
            break;
        case 0x10000000:
            name = "DSP";
            break;
        case 0x20000000:
            name = "HAL";
            break;
        case 0x40000000:
            name = "Routing";
            break;
        default:
            break;
        }
        name += "_";
    }
    std::uint32_t low = category & 0xFFFF;
    name += low <= 11 ? kCategories[low] : "Undefined";
    return name;
}

std::string MxReportingMessageTypeName(MessageType type)
{
    static constexpr std::array<const char*, 6> kTypes = {"Generic", "Start", "Stop",
                                                          "Setup",   "Error", "IssueDetector"};
    if (type == 65535)
        return "Unknown";
    return type < kTypes.size() ? kTypes[type] : "Undefined";
}

Value MxReportingHostApplicationID(const Dictionary* userInfo)
{
    if (userInfo)
        if (const Value* host = userInfo->find("HostApplicationDisplayID"))
            return *host;
    return "Unknown";
}

namespace {

struct InternalBuildFlag {
    std::mutex mutex;
    bool known = false;
    bool value = false;
};

InternalBuildFlag& internalBuildFlag()
{
    static InternalBuildFlag flag;
    return flag;
}

} // namespace

bool MxReportingInternalBuild()
{
    auto& flag = internalBuildFlag();
    std::lock_guard lock(flag.mutex);
    if (!flag.known) {
        flag.value = ProcessWide<DeviceProperties>::get().boolProperty("InternalBuild");
        flag.known = true;
    }
    return flag.value;
}

void MxReportingResetInternalBuildForTesting()
{
    auto& flag = internalBuildFlag();
    std::lock_guard lock(flag.mutex);
    flag.known = false;
}

const std::vector<std::string>& MxReportingComparisonExemptKeys()
{
    static const std::vector<std::string> kKeys = {"systemuptime_sec", "processuptime_ms", "mxreporting_timestamp",
                                                   "_comparison_field_blacklist", "_throttle_seconds"};
    return kKeys;
}

} // namespace mx
