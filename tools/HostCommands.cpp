#include "tools/HostCommands.h"

#include <cerrno>
#include <cstdio>
#include <fstream>
#include <optional>
#include <system_error>
#include <unistd.h>

#include <fmt/format.h>

#include "Statistics/MxReportingDriverUtility.h"
#include "tools/MxReportArguments.h"
#include "wire/ChannelFiles.h"
#include "wire/Datagram.h"
#include "wire/FileOwnership.h"
#include "wire/OrientationDatagram.h"
#include "wire/RootPath.h"

namespace mx {

namespace {

constexpr const char* kDomain = "com.kestrel.harmonia";

std::unique_ptr<MxReportCommand> local(MxReportCommand::Run run)
{
    return std::make_unique<MxReportCommand>(false, std::move(run));
}

std::string errnoText(int error) { return std::generic_category().message(error); }

std::filesystem::path domainPath() { return MxReportingPath(kPreferencesDirectory) / (std::string(kDomain) + ".json"); }

// The domain as stored (an empty object for a file that is missing), or nothing, said,
// for a file that is no JSON object.
std::optional<nlohmann::ordered_json> readDomain()
{
    std::ifstream stream(domainPath());
    if (!stream)
        return nlohmann::ordered_json::object();
    auto json = nlohmann::ordered_json::parse(stream, nullptr, /*allow_exceptions=*/false);
    if (json.is_discarded() || !json.is_object()) {
        std::fprintf(stderr, "mxreport: defaults: %s is no JSON object: fix or remove it\n", domainPath().c_str());
        return std::nullopt;
    }
    return json;
}

// Written to a temporary file beside it and renamed over it, so that the daemon reads
// the old domain or the new one. What to fix when it cannot be.
int writeDomain(const nlohmann::ordered_json& domain)
{
    auto path = domainPath();
    std::error_code failure;
    std::filesystem::create_directories(path.parent_path(), failure);
    auto temporary = path;
    temporary += fmt::format(".{}.tmp", getpid());
    {
        std::ofstream out(temporary);
        out << domain.dump(2) << "\n";
        if (!out) {
            int error = errno;
            std::fprintf(stderr,
                         "mxreport: defaults: cannot write in %s: %s (%s). The preferences are the daemon "
                         "user's: write them as that user or as root\n",
                         path.parent_path().c_str(), errnoText(error).c_str(),
                         describeOwnership(path.parent_path(), "this is").c_str());
            return kExitRefused;
        }
    }
    if (std::rename(temporary.c_str(), path.c_str()) != 0) {
        int error = errno;
        std::remove(temporary.c_str());
        std::fprintf(stderr, "mxreport: defaults: cannot replace %s: %s (%s)\n", path.c_str(), errnoText(error).c_str(),
                     describeOwnership(path, "this is").c_str());
        return kExitRefused;
    }
    std::printf("defaults: %s written; post the notification (mxreport notify) for the daemon to read it\n",
                path.c_str());
    return kExitDone;
}

std::unique_ptr<MxReportCommand> defaults(const Words& words)
{
    std::string verb = words.size() > 1 ? words[1] : "read";
    if (verb == "read" && words.size() <= 3) {
        std::optional<std::string> key = words.size() == 3 ? std::optional(words[2]) : std::nullopt;
        return local([key](MxReportContext&) {
            auto domain = readDomain();
            if (!domain)
                return kExitRefused;
            if (!key) {
                std::puts(domain->dump(2).c_str());
                return kExitDone;
            }
            if (!domain->contains(*key)) {
                std::fprintf(stderr, "mxreport: defaults: %s is not set\n", key->c_str());
                return kExitRefused;
            }
            std::puts((*domain)[*key].dump().c_str());
            return kExitDone;
        });
    }
    if (verb == "write" && words.size() == 4) {
        const std::string& key = words[2];
        auto parsed = nlohmann::ordered_json::parse(words[3], nullptr, false);
        nlohmann::ordered_json value = parsed.is_discarded() ? nlohmann::ordered_json(words[3]) : parsed;
        // The daemon reads these two as a bool and a string: a typo must not turn
        // "flase" into a string that reads as false.
        if (key == "disable_reporting" && !value.is_boolean())
            throw UsageError{fmt::format("disable_reporting is true or false, not {}", words[3])};
        if (key == "device_name" && !value.is_string())
            throw UsageError{fmt::format("device_name is a text, not {} (quote it: '\"{}\"')", words[3], words[3])};
        return local([key, value](MxReportContext&) {
            auto domain = readDomain();
            if (!domain)
                return kExitRefused;
            (*domain)[key] = value;
            return writeDomain(*domain);
        });
    }
    if (verb == "delete" && words.size() == 3)
        return local([key = words[2]](MxReportContext&) {
            auto domain = readDomain();
            if (!domain)
                return kExitRefused;
            domain->erase(key);
            return writeDomain(*domain);
        });
    throw UsageError{"defaults read [KEY] | defaults write KEY VALUE | defaults delete KEY"};
}

std::unique_ptr<MxReportCommand> notify(const Words& words)
{
    if (words.size() > 2)
        throw UsageError{"notify [NAME]"};
    std::string name = words.size() > 1 ? words[1] : "com.kestrel.harmonia.reporting";
    return local([name](MxReportContext&) {
        if (std::uint32_t error = postNotification(name)) {
            std::fprintf(stderr, "mxreport: notify: cannot post %s to %s: %s\n", name.c_str(),
                         MxReportingPath(kNotificationSocketPath).c_str(), errnoText(int(error)).c_str());
            return kExitUnreachable;
        }
        std::printf("notify: posted %s\n", name.c_str());
        return kExitDone;
    });
}

std::unique_ptr<MxReportCommand> orientation(const Words& words)
{
    if (words.size() != 3 || (words[1] != "device" && words[1] != "ui"))
        throw UsageError{"orientation device|ui VALUE"};
    auto value = orientationFromText(words[2]);
    if (!value)
        throw UsageError{fmt::format("\"{}\" is no orientation: a number, or unknown, portrait, "
                                     "portrait-upside-down, landscape-left, landscape-right, face-up, face-down",
                                     words[2])};
    OrientationChange change{words[1] == "device" ? OrientationKind::Device : OrientationKind::UI, *value};
    return local([change](MxReportContext&) {
        if (std::uint32_t error = postOrientationChange(change)) {
            std::fprintf(stderr, "mxreport: orientation: cannot post to %s: %s\n",
                         MxReportingPath(kOrientationFeedPath).c_str(), errnoText(int(error)).c_str());
            return kExitUnreachable;
        }
        std::printf("orientation: posted %s (%s)\n", formatOrientationDatagram(change).c_str(),
                    std::string(orientationText(change.orientation)).c_str());
        return kExitDone;
    });
}

// The daemon subscribes to the files present when it starts; a channel added since is
// listed here but sampled only after a restart.
std::unique_ptr<MxReportCommand> channels(const Words& words)
{
    bool json = words.size() == 2 && words[1] == "--json";
    if (words.size() > 1 && !json)
        throw UsageError{"channels takes --json"};
    return local([json](MxReportContext&) {
        ChannelFiles files(MxReportingPath(kChannelDirectory));
        if (!json)
            std::printf("%-22s %-28s %-20s %s\n", "DRIVER", "KEY", "VALUE", "FILE");
        for (const auto& driver : MxReportingDriverUtility::drivers()) {
            int error = 0;
            auto found = files.find(driver.groupName(), driver.subGroupName(), error);
            if (error != 0)
                std::fprintf(stderr, "mxreport: %s: %s\n", driver.description().c_str(), errnoText(error).c_str());
            for (const auto& channel : found.value_or(std::vector<ChannelFile>{})) {
                std::string key = driver.keyPrefix() + channel.name;
                auto value = ChannelFiles::readValue(channel.path, error,
                                                     std::chrono::steady_clock::now() + ChannelFiles::kRereadTime);
                std::string shown = value ? std::to_string(*value) : "(" + errnoText(error) + ")";
                if (json)
                    std::puts(nlohmann::json{{"driver", driver.description()},
                                             {"key", key},
                                             {"value", value ? nlohmann::json(*value) : nlohmann::json()},
                                             {"file", channel.path}}
                                  .dump()
                                  .c_str());
                else
                    std::printf("%-22s %-28s %-20s %s\n", driver.description().c_str(), key.c_str(), shown.c_str(),
                                channel.path.c_str());
            }
        }
        return kExitDone;
    });
}

} // namespace

std::unique_ptr<MxReportCommand> parseHostCommand(const Words& words)
{
    const std::string& name = words[0];
    if (name == "defaults")
        return defaults(words);
    if (name == "notify")
        return notify(words);
    if (name == "orientation")
        return orientation(words);
    if (name == "channels")
        return channels(words);
    return nullptr;
}

} // namespace mx
