#include "platform/Uplink.h"

#include <fmt/format.h>

namespace mx {

std::string UplinkSecureHierarchyToken::text() const
{
    std::string text;
    text.reserve(36);
    for (std::size_t i = 0; i < uuid.size(); ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10)
            text += '-';
        text += fmt::format("{:02x}", uuid[i]);
    }
    return text;
}

} // namespace mx
