#pragma once
// Preferences domains as JSON objects, one file per domain:
// var/lib/harmonia/preferences/<domain>.json under the root. Read afresh on every
// request; readable without any user session.

#include <filesystem>

#include "platform/Preferences.h"

namespace mx {

class JsonPreferences final : public Preferences {
public:
    explicit JsonPreferences(std::filesystem::path directory);
    Dictionary copyDomain(const std::string& domain) override;

    std::filesystem::path domainPath(const std::string& domain) const;

private:
    std::filesystem::path directory_;
};

} // namespace mx
