#include "tools/DemoCommand.h"

#include <cstdio>
#include <ctime>
#include <fstream>
#include <map>
#include <random>

#include <nlohmann/json.hpp>

#include "Statistics/MxReportingDriverUtility.h"
#include "tools/HostCommands.h"
#include "tools/ProtocolCommands.h"
#include "wire/ChannelFiles.h"
#include "wire/RootPath.h"

namespace mx {

namespace {

using Values = std::map<std::string, std::int64_t>; // key ("Speaker_underruns") -> value

// The daemon's four drivers' channels now, as the daemon keys their growth.
Values driverChannels()
{
    Values values;
    ChannelFiles files(MxReportingPath(kChannelDirectory));
    for (const auto& driver : MxReportingDriverUtility::drivers()) {
        int error = 0;
        for (const auto& channel :
             files.find(driver.groupName(), driver.subGroupName(), error).value_or(std::vector<ChannelFile>{}))
            if (auto value = ChannelFiles::readValue(channel.path, error,
                                                     std::chrono::steady_clock::now() + ChannelFiles::kRereadTime))
                values[driver.keyPrefix() + channel.name] = *value;
    }
    return values;
}

std::string growthSince(const Values& before)
{
    nlohmann::ordered_json grown = nlohmann::ordered_json::object();
    for (const auto& [key, value] : driverChannels())
        if (auto earlier = before.find(key); earlier != before.end() && value - earlier->second >= 1)
            grown[key] = value - earlier->second;
    return grown.empty() ? "none grew" : grown.dump();
}

bool internalBuild()
{
    auto properties = nlohmann::json::parse(std::ifstream(MxReportingPath(kDevicePropertiesPath)), nullptr, false,
                                            /*ignore_comments=*/true);
    return properties.is_object() && properties.value("InternalBuild", false) == true;
}

// The summary event of the demo's session, as its summary file ends: on an internal
// build it carries the orientation changes with their times since the start.
void showSummaryEvent()
{
    auto directory = MxReportingPath("var/log/harmonia/reporting");
    std::error_code error;
    std::filesystem::path newest;
    auto newestTime = std::filesystem::file_time_type::min();
    for (const auto& entry : std::filesystem::directory_iterator(directory, error))
        if (entry.path().filename().string().find("com.example.player") != std::string::npos &&
            entry.last_write_time() >= newestTime) {
            newest = entry.path();
            newestTime = entry.last_write_time();
        }
    auto document = nlohmann::ordered_json::parse(std::ifstream(newest), nullptr, false);
    if (newest.empty() || !document.is_array() || document.empty()) {
        std::printf("\n(no summary file to show in %s)\n", directory.c_str());
        return;
    }
    std::printf("\nAn internal build: the session's summary file %s ends with its summary event,\n"
                "orientation changes and their times since the start included:\n%s\n",
                newest.c_str(), document.back().dump(2).c_str());
}

int play(MxReportContext& context)
{
    std::mt19937_64 random{std::random_device{}()};
    std::string reporter = std::to_string(random() % 1000000000 + 1);
    std::string timestamp = std::to_string(std::time(nullptr));
    std::vector<Words> script = {
        {"create", reporter},
        {"type", reporter, "longformaudio"},
        {"configure", reporter, R"({"HostApplicationDisplayID": "com.example.player", "output route": "Speaker"})"},
        {"start", reporter},
        {"send", R"({"sample rate": 48000, "codec": "aac"})", "Session_Playback", "Start", reporter},
        {"orientation", "device", "landscape-left"},
        {"orientation", "ui", "landscape-right"},
        {"send", R"({"route": "Headphones", "reason": "new device"})", "Routing_RouteChange", "Generic", reporter},
        {"send", R"({"EngineOnTime": 12.5, "mxreporting_timestamp": )" + timestamp + "}", "Volume", "Generic",
         reporter},
        {"send", R"({"sample rate": 44100, "underruns": 0})", "Session_Playback", "Stop", reporter},
        {"reporters"},
        {"valid", reporter},
        {"stop", reporter},
        {"destroy", reporter},
    };
    std::printf("demo: one long-form audio session, reporter %s\n", reporter.c_str());
    // Sampled as the daemon samples them, to show the growth its stop reports.
    Values atStart = driverChannels();
    for (const auto& words : script) {
        std::string line;
        for (const auto& word : words)
            line += (line.empty() ? "" : " ") + word;
        std::printf("\n$ mxreport %s\n", line.c_str());
        std::fflush(stdout);
        if (words[0] == "stop" && !atStart.empty())
            std::printf("(driver growth since the start, sent as a DriverStats message: %s)\n",
                        growthSince(atStart).c_str());
        auto command = words[0] == "orientation" ? parseHostCommand(words) : parseProtocolCommand(words);
        if (int status = command->run(context); status != kExitDone)
            return status;
        std::fflush(stdout);
    }
    if (internalBuild())
        showSummaryEvent();
    std::printf("\nSee what the daemon stored: mxreport events, mxreport power, mxreport sessions,\n"
                "mxreport messages (add --json for machine-readable lines).\n");
    return kExitDone;
}

} // namespace

std::unique_ptr<MxReportCommand> parseDemoCommand(const Words& words)
{
    if (words[0] != "demo")
        return nullptr;
    if (words.size() > 1)
        throw UsageError{"demo takes no arguments"};
    return std::make_unique<MxReportCommand>(true, play);
}

} // namespace mx
