#include "platform/linux/StoreLimits.h"

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "platform/linux/ConfigFile.h"

namespace mx {

namespace {

using Json = nlohmann::json;

// The section `name` of the document: each of `keys` a number of at least 0.
bool readSection(ConfigFile& file, const Json& document, const char* name, std::initializer_list<std::string_view> keys,
                 std::vector<double*> values)
{
    if (!document.contains(name))
        return true;
    const Json& section = document[name];
    auto at = ConfigFile::Pointer() / std::string(name);
    if (!file.expect(section.is_object(), at, "an object"))
        return false;
    bool good = file.onlyKeys(at, keys);
    std::size_t index = 0;
    for (auto key : keys) {
        auto found = section.find(key);
        double* value = values[index++];
        if (found == section.end())
            continue;
        if (file.expect(found->is_number() && found->get<double>() >= 0, at / std::string(key),
                        "a number of at least 0"))
            *value = found->get<double>();
        else
            good = false;
    }
    return good;
}

bool readStore(ConfigFile& file, const Json& document, const char* name, StoreLimit& limit)
{
    double bytes = static_cast<double>(limit.maxBytes);
    double days = static_cast<double>(limit.maxAge.count()) / 86400;
    if (!readSection(file, document, name, {"max_bytes", "max_age_days"}, {&bytes, &days}))
        return false;
    limit.maxBytes = static_cast<std::uint64_t>(bytes);
    limit.maxAge = std::chrono::seconds(static_cast<std::int64_t>(days * 86400));
    return true;
}

} // namespace

std::optional<StoreLimits> StoreLimits::read(const std::filesystem::path& path, std::vector<std::string>& errors)
{
    StoreLimits limits;
    ConfigFile file(path, errors);
    if (!file.exists())
        return limits;
    const Json* document = file.document();
    if (!document)
        return std::nullopt;
    if (!document->is_object()) {
        file.fail(ConfigFile::Pointer(), "expected an object of store limits");
        return std::nullopt;
    }
    bool good = file.onlyKeys(ConfigFile::Pointer(), {"tally", "joule", "uplink", "summaries"});
    double files = static_cast<double>(limits.summaries.maxFiles);
    double bytes = static_cast<double>(limits.summaries.maxBytes);
    good &= readStore(file, *document, "tally", limits.tally);
    good &= readStore(file, *document, "joule", limits.joule);
    good &= readStore(file, *document, "uplink", limits.uplink);
    good &= readSection(file, *document, "summaries", {"max_files", "max_bytes"}, {&files, &bytes});
    if (!good)
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
            {},
            "SELECT time FROM events ORDER BY id LIMIT 1"};
}

} // namespace mx
