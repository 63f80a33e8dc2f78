#include "platform/linux/JsonPreferences.h"

#include <fstream>

#include "platform/MxLog.h"
#include "value/JsonValue.h"

namespace mx {

JsonPreferences::JsonPreferences(std::filesystem::path directory) : directory_(std::move(directory)) {}

std::filesystem::path JsonPreferences::domainPath(const std::string& domain) const
{
    return directory_ / (domain + ".json");
}

Dictionary JsonPreferences::copyDomain(const std::string& domain)
{
    std::ifstream stream(domainPath(domain));
    if (!stream)
        return {};
    auto json = nlohmann::ordered_json::parse(stream, nullptr, /*allow_exceptions=*/false);
    if (json.is_discarded() || !json.is_object()) {
        MXLOG_LIMITED(nullptr, Error, "ignoring preferences {}: not a JSON object", domainPath(domain).string());
        return {};
    }
    return *fromJson(json).asDictionary();
}

} // namespace mx
