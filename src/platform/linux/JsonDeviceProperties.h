#pragma once
// Device properties read from etc/harmonia/device.json under the root, a JSON object
// such as {"InternalBuild": true, "DeviceClassNumber": 1}. The file is read on every
// query: it is tiny, and queries are rare (the build flag is cached by its reader).

#include <filesystem>
#include <string>
#include <vector>

#include "platform/DeviceProperties.h"

namespace mx {

class JsonDeviceProperties final : public DeviceProperties {
public:
    explicit JsonDeviceProperties(std::filesystem::path file);
    // Whether `file` is as above: only those two keys, a bool and an integer. Errors
    // are added to `errors`.
    static bool check(const std::filesystem::path& file, std::vector<std::string>& errors);

    bool boolProperty(std::string_view key) override;
    std::int64_t integerProperty(std::string_view key) override;

private:
    std::filesystem::path file_;
};

} // namespace mx
