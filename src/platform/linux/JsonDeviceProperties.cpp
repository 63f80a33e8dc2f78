#include "platform/linux/JsonDeviceProperties.h"

#include <fstream>

#include <nlohmann/json.hpp>

#include "platform/MxLog.h"
#include "platform/linux/ConfigFile.h"

namespace mx {

namespace {

nlohmann::json readProperty(const std::filesystem::path& file, std::string_view key)
{
    std::ifstream stream(file);
    if (!stream)
        return nullptr;
    auto properties = nlohmann::json::parse(stream, nullptr, /*allow_exceptions=*/false, /*ignore_comments=*/true);
    if (properties.is_discarded() || !properties.is_object()) {
        MXLOG_LIMITED(nullptr, Error, "ignoring unreadable device properties in {}", file.string());
        return nullptr;
    }
    auto found = properties.find(key);
    return found == properties.end() ? nlohmann::json() : *found;
}

} // namespace

JsonDeviceProperties::JsonDeviceProperties(std::filesystem::path file) : file_(std::move(file)) {}

bool JsonDeviceProperties::check(const std::filesystem::path& file, std::vector<std::string>& errors)
{
    ConfigFile config(file, errors);
    if (!config.exists())
        return true;
    const nlohmann::json* document = config.document();
    if (!document)
        return false;
    if (!document->is_object()) {
        config.fail(ConfigFile::Pointer(), "expected an object of device properties");
        return false;
    }
    bool good = config.onlyKeys(ConfigFile::Pointer(), {"InternalBuild", "DeviceClassNumber"});
    if (auto flag = document->find("InternalBuild"); flag != document->end())
        good &= config.expect(flag->is_boolean(), ConfigFile::Pointer("/InternalBuild"), "true or false");
    if (auto number = document->find("DeviceClassNumber"); number != document->end())
        good &= config.expect(number->is_number_integer(), ConfigFile::Pointer("/DeviceClassNumber"), "an integer");
    return good;
}

bool JsonDeviceProperties::boolProperty(std::string_view key)
{
    auto value = readProperty(file_, key);
    return value.is_boolean() && value.get<bool>();
}

std::int64_t JsonDeviceProperties::integerProperty(std::string_view key)
{
    auto value = readProperty(file_, key);
    if (value.is_number_integer())
        return value.get<std::int64_t>();
    if (value.is_number_float())
        return static_cast<std::int64_t>(value.get<double>());
    return 0;
}

} // namespace mx
