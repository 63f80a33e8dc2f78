#include "Statistics/MxReportingDriver.h"

namespace mx {

std::string MxReportingDriver::description() const
{
    return groupName_.value_or("(null)") + "-" + subGroupName_.value_or("(null)");
}

std::string MxReportingDriver::keyPrefix() const
{
    std::string prefix;
    if (groupName_)
        prefix += *groupName_ + "_";
    if (subGroupName_)
        prefix += *subGroupName_ + "_";
    return prefix;
}

} // namespace mx
