#include "platform/linux/StoreLimits.h"

#include <fstream>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

namespace mx {

namespace {

using Json = nlohmann::json;

bool readNumber(const Json& section, const char* key, double& value, std::string& error, const std::string& where)
{
    if (!section.contains(key))
        return true;
    const Json& number = section[key];
    if (!number.is_number() || number.get<double>() < 0) {
        error = fmt::format("{}: \"{}\" must be a number of at least 0", where, key);
        return false;
    }
    value = number.get<double>();
    return true;
}

bool readSection(const Json& document, const char* name, const std::vector<const char*>& keys,
                 std::vector<double*> values, std::string& error, const std::string& file)
{
    if (!document.contains(name))
        return true;
    const Json& section = document[name];
    std::string where = fmt::format("{}: \"{}\"", file, name);
    if (!section.is_object()) {
        error = where + " must be an object";
        return false;
    }
    for (const auto& [key, value] : section.items())
        if (std::find(keys.begin(), keys.end(), key) == keys.end()) {
            error = fmt::format("{} has no setting \"{}\"", where, key);
            return false;
        }
    for (std::size_t i = 0; i < keys.size(); ++i)
        if (!readNumber(section, keys[i], *values[i], error, where))
            return false;
    return true;
}

bool readStore(const Json& document, const char* name, StoreLimit& limit, std::string& error, const std::string& file)
{
    double bytes = static_cast<double>(limit.maxBytes);
    double days = static_cast<double>(limit.maxAge.count()) / 86400;
    if (!readSection(document, name, {"max_bytes", "max_age_days"}, {&bytes, &days}, error, file))
        return false;
    limit.maxBytes = static_cast<std::uint64_t>(bytes);
    limit.maxAge = std::chrono::seconds(static_cast<std::int64_t>(days * 86400));
    return true;
}

} // namespace

std::optional<StoreLimits> StoreLimits::read(const std::filesystem::path& file, std::string& error)
{
    StoreLimits limits;
    std::ifstream stream(file);
    if (!stream)
        return limits;
    Json document = Json::parse(stream, nullptr, /*allow_exceptions=*/false);
    if (!document.is_object()) {
        error = file.string() + ": expected an object of store limits";
        return std::nullopt;
    }
    for (const auto& [key, value] : document.items())
        if (key != "tally" && key != "joule" && key != "uplink" && key != "summaries") {
            error = fmt::format("{}: no store is called \"{}\"", file.string(), key);
            return std::nullopt;
        }
    double files = static_cast<double>(limits.summaries.maxFiles);
    double bytes = static_cast<double>(limits.summaries.maxBytes);
    if (!readStore(document, "tally", limits.tally, error, file.string()) ||
        !readStore(document, "joule", limits.joule, error, file.string()) ||
        !readStore(document, "uplink", limits.uplink, error, file.string()) ||
        !readSection(document, "summaries", {"max_files", "max_bytes"}, {&files, &bytes}, error, file.string()))
        return std::nullopt;
    limits.summaries = {static_cast<std::size_t>(files), static_cast<std::uint64_t>(bytes)};
    return limits;
}

SqliteRetention eventsRetention(const StoreLimit& limit)
{
    return {limit.maxBytes,
            limit.maxAge,
            {{"DELETE FROM events WHERE id IN (SELECT id FROM events WHERE time < ?1 ORDER BY id LIMIT ?2)"}},
            {{"DELETE FROM events WHERE id IN (SELECT id FROM events ORDER BY id LIMIT ?1)"}},
            {}};
}

} // namespace mx
