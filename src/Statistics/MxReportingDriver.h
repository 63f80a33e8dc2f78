#pragma once
// One audio driver's channel group and subgroup, as the driver statistics sampler
// subscribes to it. Its description ("Haptics-Stats", "(null)-MCA") keys the driver in
// snapshots; its key prefix ("Haptics_Stats_") starts the names of its statistics.
// An immutable value.

#include <optional>
#include <string>

namespace mx {

class MxReportingDriver {
public:
    // driverWithGroupName:subGroupName:
    MxReportingDriver(std::optional<std::string> groupName, std::optional<std::string> subGroupName)
        : groupName_(std::move(groupName)), subGroupName_(std::move(subGroupName))
    {
    }

    const std::optional<std::string>& groupName() const { return groupName_; }
    const std::optional<std::string>& subGroupName() const { return subGroupName_; }
    // The two names joined by "-", an absent one written "(null)".
    std::string description() const;
    // Each present name followed by "_".
    std::string keyPrefix() const;

private:
    std::optional<std::string> groupName_;
    std::optional<std::string> subGroupName_;
};

} // namespace mx
