// mxreport: the operator's and script's way to talk to mxreportingd. Every protocol
// operation, the preferences domain, the notification, and a demo session.
// Operations given in one invocation (separated by "--") share one connection, as
// sessions belong to the connection that created them.
//
// Exit status: 0 done; 1 the daemon refused or failed an operation; 2 the daemon
// cannot be reached; 64 bad usage.

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <future>
#include <iostream>
#include <map>
#include <mutex>
#include <random>
#include <sstream>
#include <string>
#include <thread>
#include <unistd.h>
#include <vector>

#include <fmt/format.h>

#include "Statistics/MxReportingDriverUtility.h"
#include "Statistics/MxReportingVocabulary.h"
#include "Statistics/Service/MxReportingBlockThrottle.h"
#include "client/MxReportingClient.h"
#include "platform/linux/FileChanstat.h"
#include "platform/linux/JsonDeviceProperties.h"
#include "platform/linux/JsonPreferences.h"
#include "value/JsonValue.h"
#include "value/ValueText.h"
#include "wire/Datagram.h"
#include "wire/MxReportingMethods.h"
#include "wire/OrientationDatagram.h"
#include "wire/RootPath.h"

using namespace mx;

namespace {

constexpr int kExitRefused = 1;
constexpr int kExitUnreachable = 2;
constexpr int kExitUsage = 64;

constexpr const char* kUsage =
    R"(usage: mxreport [--socket PATH] [--timeout SECONDS] COMMAND [ARGS] [-- COMMAND [ARGS]]...
       mxreport --help | --version

Talks to mxreportingd on $MXREPORTING_ROOT/run/harmonia/reporting.sock. Commands joined
by "--" run in order on one connection (a session lives as long as its connection).

Protocol operations:
  create ID                         createReportingSession
  type ID SERVICE_TYPE              setServiceType (number or name: longformaudio, alarms, ...)
  service-type ID                   getServiceNameForReporterID (prints the number)
  configure ID JSON_OBJECT          setConfiguration
  start ID [--wait]                 startReportingSessionForID (its reply comes at stop)
  send JSON_OBJECT CATEGORY TYPE [ID... | --none]
                                    sendMessage; without IDs to every started session,
                                    --none for an empty list. CATEGORY by number (0x08000003)
                                    or name (Session_Playback); TYPE by number or name (Start)
  stop ID                           stopReportingSessionForID
  destroy ID                        destroyReportingSession
  valid ID                          reporterID:valid:
  reporters                         getAllReporters
  kill                              killService (the daemon exits with status 2)

Preferences (domain com.kestrel.harmonia) and notifications:
  defaults read [KEY]               print the domain or one key
  defaults write KEY VALUE          VALUE as JSON (true, 3, "name"), else as a string
  defaults delete KEY
  notify [NAME]                     post NAME (default com.kestrel.harmonia.reporting)

Orientation (recorded by long-form audio and telephony sessions on internal builds):
  orientation device|ui VALUE       post one change to the orientation feed; VALUE by
                                    number or name (portrait, landscape-left, face-up, ...)

What the stores hold (newest last; --json for one JSON object a line):
  events [--limit N] [--json]       analytics events (tally.db)
  power [--limit N] [--json]        power log events (joule.db)
  sessions [--limit N] [--json]     backend sessions (uplink.db)
  messages [--limit N] [--json]     backend messages (uplink.db)

The block throttle (a burst of one message key delivers only its last message):
  throttle-key JSON_OBJECT [--reporter ID] [--category C] [--type T]
                                    print the message key, then the throttle time
  stream [--throttle] [-v] [ID...]  send one JSON object a line from stdin,
                                    {"payload": {...}, "category": C, "type": T}, to the IDs
                                    (none: to every started session); --throttle holds each
                                    in one throttle and waits for the last at end of input

Driver channels (run/harmonia/chanstat/GROUP[/SUBGROUP]/NAME, one integer a file):
  channels [--json]                 the channels of the daemon's four drivers and their
                                    values now, with the key their growth is reported as

  status [--json]                   what the daemon is doing: clients, sessions, reports and
                                    their rate, each store's rows, queue, size and failures,
                                    each exporter's lag and last error

  demo                              play a realistic session and show what happens
  help                              this text
)";

struct UsageError {
    std::string message;
};

std::int64_t parseInteger(const std::string& text, const char* what)
{
    try {
        std::size_t used = 0;
        long long value = std::stoll(text, &used, 0);
        if (used == text.size())
            return value;
    } catch (const std::exception&) {
    }
    throw UsageError{fmt::format("{} must be a number, not \"{}\"", what, text)};
}

// Decimal only, where a leading zero must not make a number octal.
std::int64_t parseDecimal(const std::string& text, const char* what)
{
    std::int64_t value = 0;
    auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), value, 10);
    if (text.empty() || failure != std::errc() || end != text.data() + text.size())
        throw UsageError{fmt::format("{} must be a decimal number, not \"{}\"", what, text)};
    return value;
}

template <class Name>
std::int64_t parseNamed(const std::string& text, const char* what, std::int64_t maximum, Name name,
                        const std::vector<std::int64_t>& candidates)
{
    if (!text.empty() && (std::isdigit(static_cast<unsigned char>(text[0])) || text[0] == '-')) {
        auto value = parseInteger(text, what);
        if (value < 0 || value > maximum)
            throw UsageError{fmt::format("{} {} is out of range", what, text)};
        return value;
    }
    for (auto candidate : candidates)
        if (name(candidate) == text)
            return candidate;
    throw UsageError{fmt::format("unknown {} \"{}\"", what, text)};
}

ServiceType parseServiceType(const std::string& text)
{
    std::vector<std::int64_t> codes;
    for (int code = 0; code <= 12; ++code)
        codes.push_back(code);
    codes.push_back(65535);
    return static_cast<ServiceType>(parseNamed(
        text, "service type", 0xFFFF, [](std::int64_t code) { return MxReportingServiceTypeName(ServiceType(code)); },
        codes));
}

MessageCategory parseCategory(const std::string& text)
{
    std::vector<std::int64_t> codes;
    for (std::int64_t subsystem : {0x0ll, 0x80000000ll, 0x08000000ll, 0x10000000ll, 0x20000000ll, 0x40000000ll})
        for (std::int64_t low = 0; low <= 11; ++low)
            codes.push_back(subsystem | low);
    return static_cast<MessageCategory>(parseNamed(
        text, "category", 0xFFFFFFFF, [](std::int64_t code) { return MxReportingCategoryName(MessageCategory(code)); },
        codes));
}

MessageType parseMessageType(const std::string& text)
{
    return static_cast<MessageType>(parseNamed(
        text, "message type", 0xFFFF, [](std::int64_t code) { return MxReportingMessageTypeName(MessageType(code)); },
        {0, 1, 2, 3, 4, 5, 65535}));
}

Dictionary parseObject(const std::string& text)
{
    auto json = nlohmann::ordered_json::parse(text, nullptr, /*allow_exceptions=*/false);
    if (json.is_discarded() || !json.is_object())
        throw UsageError{fmt::format("expected a JSON object, not {}", text)};
    return *fromJson(json).asDictionary();
}

std::string show(const Value& value) { return toJson(value).dump(); }

class Session {
public:
    Session(MxReportingClient& client) : client_(client) {}

    // Runs one command; returns false when the daemon refused or failed it.
    bool run(const std::vector<std::string>& words)
    {
        const std::string& command = words.at(0);
        auto argument = [&](std::size_t index) -> const std::string& {
            if (index >= words.size())
                throw UsageError{fmt::format("{} needs more arguments (see mxreport help)", command)};
            return words[index];
        };
        auto id = [&](std::size_t index) {
            return parseInteger(argument(index), "reporter ID");
        };

        if (command == "create")
            return report(command, client_.createReportingSession(id(1)));
        if (command == "type")
            return report(command, client_.setServiceType(parseServiceType(argument(2)), id(1)));
        if (command == "service-type")
            return report(command, client_.getServiceNameForReporterID(id(1)));
        if (command == "configure")
            return report(command, client_.setConfiguration(parseObject(argument(2)), id(1)));
        if (command == "start")
            return start(id(1), words.size() > 2 && words[2] == "--wait");
        if (command == "send")
            return send(words);
        if (command == "stop")
            return report(command, client_.stopReportingSessionForID(id(1)));
        if (command == "destroy")
            return report(command, client_.destroyReportingSession(id(1)));
        if (command == "valid")
            return report(command, client_.reporterID(id(1)));
        if (command == "reporters")
            return report(command, client_.getAllReporters());
        if (command == "kill") {
            client_.killService();
            std::puts("kill: sent (the daemon exits with status 2)");
            return true;
        }
        throw UsageError{fmt::format("unknown command \"{}\" (see mxreport help)", command)};
    }

private:
    bool start(ReporterID reporterID, bool wait)
    {
        if (wait)
            return report("start", waitForStart(reporterID));
        // The reply is held by the daemon until the session is stopped; it is printed
        // when it comes.
        client_.startReportingSessionForID(reporterID, [reporterID](MxClientResult<bool> result) {
            if (result)
                std::printf("start %lld: %s (held reply, answered now)\n", static_cast<long long>(reporterID),
                            *result.value ? "true" : "false");
            std::fflush(stdout);
        });
        std::printf("start %lld: sent, its reply is held until the session stops\n",
                    static_cast<long long>(reporterID));
        return true;
    }

    MxClientResult<bool> waitForStart(ReporterID reporterID)
    {
        std::promise<MxClientResult<bool>> reply;
        client_.startReportingSessionForID(reporterID,
                                           [&](const MxClientResult<bool>& result) { reply.set_value(result); });
        return reply.get_future().get();
    }

    bool send(const std::vector<std::string>& words)
    {
        if (words.size() < 4)
            throw UsageError{"send needs a JSON object, a category and a type"};
        std::optional<std::vector<ReporterID>> ids;
        for (std::size_t i = 4; i < words.size(); ++i) {
            if (!ids)
                ids.emplace();
            if (words[i] != "--none")
                ids->push_back(parseInteger(words[i], "reporter ID"));
        }
        auto result =
            client_.sendMessage(parseObject(words[1]), parseCategory(words[2]), parseMessageType(words[3]), ids);
        if (result && *result.value) {
            std::printf("send: refused: domain %s code %lld (reporting is switched off)\n",
                        (*result.value)->domain.c_str(), static_cast<long long>((*result.value)->code));
            return false;
        }
        return report("send", result);
    }

    template <class T>
    bool report(const std::string& command, const MxClientResult<T>& result)
    {
        if (!result) {
            std::fprintf(stderr, "%s: %s\n", command.c_str(), result.error ? result.error->message.c_str() : "failed");
            return false;
        }
        std::printf("%s: %s\n", command.c_str(), describe(*result.value).c_str());
        return true;
    }

    static std::string describe(bool value) { return value ? "true" : "false"; }
    static std::string describe(ServiceType value)
    {
        return fmt::format("{} ({})", value, MxReportingServiceTypeName(value));
    }
    static std::string describe(const Dictionary& value) { return show(value); }
    static std::string describe(const MxSendOutcome&) { return "accepted"; }
    static std::string describe(const std::vector<ReporterID>& value)
    {
        return show(Array(std::vector<Value>(value.begin(), value.end())));
    }

    MxReportingClient& client_;
};

std::filesystem::path preferencesDirectory() { return MxReportingPath("var/lib/harmonia/preferences"); }

int defaults(const std::vector<std::string>& words)
{
    const std::string domain = "com.kestrel.harmonia";
    JsonPreferences preferences(preferencesDirectory());
    Dictionary stored = preferences.copyDomain(domain);
    std::string verb = words.size() > 1 ? words[1] : "read";
    if (verb == "read") {
        if (words.size() > 2) {
            const Value* value = stored.find(words[2]);
            if (!value) {
                std::fprintf(stderr, "defaults: %s is not set\n", words[2].c_str());
                return kExitRefused;
            }
            std::puts(show(*value).c_str());
        } else {
            std::puts(toJson(stored).dump(2).c_str());
        }
        return 0;
    }
    if (verb == "write" && words.size() == 4) {
        auto json = nlohmann::ordered_json::parse(words[3], nullptr, false);
        Value value = json.is_discarded() ? Value(words[3]) : fromJson(json);
        // The daemon reads these two as a bool and a string: a typo must not turn
        // "flase" into a string that reads as false.
        if (words[2] == "disable_reporting" && !value.asBool())
            throw UsageError{fmt::format("disable_reporting is true or false, not {}", words[3])};
        if (words[2] == "device_name" && !value.asString())
            throw UsageError{fmt::format("device_name is a text, not {} (quote it: '\"{}\"')", words[3], words[3])};
        stored.set(words[2], std::move(value));
    } else if (verb == "delete" && words.size() == 3) {
        stored.erase(words[2]);
    } else {
        throw UsageError{"defaults read [KEY] | write KEY VALUE | delete KEY"};
    }
    auto path = preferences.domainPath(domain);
    std::filesystem::create_directories(path.parent_path());
    auto temporary = path;
    temporary += ".tmp";
    std::ofstream(temporary) << toJson(stored).dump(2) << "\n";
    std::filesystem::rename(temporary, path);
    std::printf("defaults: %s written; post the notification (mxreport notify) for the daemon to read it\n",
                path.c_str());
    return 0;
}

int notify(const std::vector<std::string>& words)
{
    std::string name = words.size() > 1 ? words[1] : "com.kestrel.harmonia.reporting";
    std::uint32_t status = postNotification(name);
    if (status != 0) {
        std::fprintf(stderr, "notify: cannot post %s: %s\n", name.c_str(),
                     std::generic_category().message(static_cast<int>(status)).c_str());
        return kExitUnreachable;
    }
    std::printf("notify: posted %s\n", name.c_str());
    return 0;
}

int orientation(const std::vector<std::string>& words)
{
    if (words.size() != 3 || (words[1] != "device" && words[1] != "ui"))
        throw UsageError{"orientation device|ui VALUE"};
    auto value = orientationFromText(words[2]);
    if (!value)
        throw UsageError{fmt::format("\"{}\" is no orientation: a number, or unknown, portrait, "
                                     "portrait-upside-down, landscape-left, landscape-right, face-up, face-down",
                                     words[2])};
    OrientationChange change{words[1] == "device" ? OrientationKind::Device : OrientationKind::UI, *value};
    if (std::uint32_t status = postOrientationChange(change)) {
        std::fprintf(stderr, "orientation: cannot post: %s\n",
                     std::generic_category().message(static_cast<int>(status)).c_str());
        return kExitUnreachable;
    }
    std::printf("orientation: posted %s (%s)\n", formatOrientationDatagram(change).c_str(),
                std::string(orientationText(*value)).c_str());
    return 0;
}

class QuietLog final : public MxLogSink {
public:
    void write(const MxLogRecord&) override {}
};

// The summary event of the demo's session, as its summary file ends: on an internal
// build it carries the orientation changes with their times since the start.
void showSummaryEvent()
{
    std::error_code error;
    std::filesystem::path newest;
    auto newestTime = std::filesystem::file_time_type::min();
    for (const auto& entry :
         std::filesystem::directory_iterator(MxReportingPath("var/log/harmonia/reporting"), error)) {
        if (entry.path().filename().string().find("com.example.player") != std::string::npos &&
            entry.last_write_time() >= newestTime) {
            newest = entry.path();
            newestTime = entry.last_write_time();
        }
    }
    auto document = nlohmann::ordered_json::parse(std::ifstream(newest), nullptr, false);
    if (newest.empty() || !document.is_array() || document.empty()) {
        std::printf("\n(no summary file to show in %s)\n", MxReportingPath("var/log/harmonia/reporting").c_str());
        return;
    }
    std::printf("\nAn internal build: the session's summary file %s ends with its summary event,\n"
                "orientation changes and their times since the start included:\n%s\n",
                newest.c_str(), document.back().dump(2).c_str());
}

int demo(MxReportingClient& client)
{
    std::mt19937_64 random{std::random_device{}()};
    ReporterID id = static_cast<ReporterID>(random() % 1000000000) + 1;
    std::string reporter = std::to_string(id);
    std::string timestamp = std::to_string(std::time(nullptr));
    std::vector<std::vector<std::string>> script = {
        {"create", reporter},
        {"type", reporter, "longformaudio"},
        {"configure", reporter, R"({"HostApplicationDisplayID": "com.example.player", "output route": "Speaker"})"},
        {"start", reporter},
        // After a reply: the start (whose own reply waits for the stop) has been taken.
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
    // The same sampling as the daemon's, to show the driver growth its stop reports.
    QuietLog quiet;
    ScopedInstall<MxLogSink> silence(quiet);
    FileChanstat files(MxReportingPath("run/harmonia/chanstat"));
    MxReportingDriverUtility drivers(files);
    auto snapShot = drivers.getSnapShot();
    Session session(client);
    for (const auto& words : script) {
        std::string line;
        for (const auto& word : words)
            line += (line.empty() ? "" : " ") + word;
        std::printf("\n$ mxreport %s\n", line.c_str());
        std::fflush(stdout);
        if (words[0] == "stop" && !drivers.ioChannelSubscriptions().empty()) {
            auto growth = drivers.getDriverStatisticsRelativeToSnapShot(&snapShot);
            std::printf("(driver growth since the start, sent as a DriverStats message: %s)\n",
                        growth ? Value(*growth).description().c_str() : "none grew");
        }
        if (words[0] == "orientation" ? orientation(words) != 0 : !session.run(words))
            return kExitRefused;
        std::fflush(stdout);
    }
    if (JsonDeviceProperties(MxReportingPath("etc/harmonia/device.json")).boolProperty("InternalBuild"))
        showSummaryEvent();
    std::printf("\nSee what the daemon stored: mxreport events, mxreport power, mxreport sessions,\n"
                "mxreport messages (add --json for machine-readable lines).\n");
    return 0;
}

// The throttle's lines on stderr, its debug lines only when asked for.
class StderrLog final : public MxLogSink {
public:
    explicit StderrLog(bool verbose) : verbose_(verbose) {}
    void write(const MxLogRecord& record) override
    {
        if (record.level != MxLogLevel::Debug || verbose_)
            std::fprintf(stderr, "%s\n", record.text.c_str());
    }

private:
    bool verbose_;
};

int throttleKey(const std::vector<std::string>& words)
{
    if (words.size() < 2 || words.size() % 2 != 0)
        throw UsageError{"throttle-key JSON_OBJECT [--reporter ID] [--category C] [--type T]"};
    Dictionary payload = parseObject(words[1]);
    ReporterID reporter = 0;
    MessageCategory category = 0;
    MessageType type = 0;
    for (std::size_t i = 2; i < words.size(); i += 2) {
        if (words[i] == "--reporter")
            reporter = parseDecimal(words[i + 1], "reporter ID");
        else if (words[i] == "--category")
            category = parseCategory(words[i + 1]);
        else if (words[i] == "--type")
            type = parseMessageType(words[i + 1]);
        else
            throw UsageError{"unknown option " + words[i]};
    }
    std::printf("%s\n", MxReportingBlockThrottle::buildMessageKey(payload, reporter, category, type).c_str());
    std::printf("%s\n", fmt::format("{}", MxReportingBlockThrottle::determineSleepTime(payload)).c_str());
    return 0;
}

// One line of a stream: the message and where it goes.
struct StreamedMessage {
    Dictionary payload;
    MessageCategory category = 0;
    MessageType type = 0;
};

StreamedMessage parseStreamLine(const std::string& line)
{
    auto json = nlohmann::ordered_json::parse(line, nullptr, /*allow_exceptions=*/false);
    if (!json.is_object() || !json.contains("payload") || !json["payload"].is_object())
        throw UsageError{"expected {\"payload\": {...}, \"category\": C, \"type\": T}"};
    auto code = [&](const char* key) {
        const auto& value = json.contains(key) ? json[key] : nlohmann::ordered_json(0);
        return value.is_string() ? value.get<std::string>() : value.dump();
    };
    return {*fromJson(json["payload"]).asDictionary(), parseCategory(code("category")), parseMessageType(code("type"))};
}

int stream(MxReportingClient& client, const std::vector<std::string>& words)
{
    bool throttled = false;
    bool verbose = false;
    std::optional<std::vector<ReporterID>> ids;
    for (std::size_t i = 1; i < words.size(); ++i) {
        if (words[i] == "--throttle")
            throttled = true;
        else if (words[i] == "-v")
            verbose = true;
        else
            (ids ? *ids : ids.emplace()).push_back(parseInteger(words[i], "reporter ID"));
    }
    StderrLog log(verbose);
    ScopedInstall<MxLogSink> installLog(log);
    std::atomic<int> failures{0};
    // Each delivery waits for the daemon's reply: a daemon that does not answer keeps
    // the throttle busy rather than piling requests up.
    auto send = [&client, ids, &failures](const StreamedMessage& message) {
        auto outcome = client.sendMessage(message.payload, message.category, message.type, ids);
        if (!outcome || outcome.value->has_value()) {
            std::fprintf(stderr, "mxreport: send: %s\n",
                         outcome ? "refused: reporting is off" : outcome.error->message.c_str());
            ++failures;
        }
    };
    auto throttle = throttled ? MxReportingBlockThrottle::make() : nullptr;
    // The line each held key's latest message came from, until its delivery ends.
    std::mutex heldMutex;
    std::map<std::string, int> held;
    std::string line;
    for (int number = 1; std::getline(std::cin, line); ++number) {
        if (line.empty())
            continue;
        try {
            auto message = parseStreamLine(line);
            if (!throttle) {
                send(message);
                continue;
            }
            ReporterID reporter = ids && !ids->empty() ? ids->front() : 0;
            std::string key =
                MxReportingBlockThrottle::buildMessageKey(message.payload, reporter, message.category, message.type);
            {
                std::lock_guard lock(heldMutex);
                held[key] = number;
            }
            throttle->addMessageBlock(
                [send, message, key, &heldMutex, &held] {
                    send(message);
                    std::lock_guard lock(heldMutex);
                    held.erase(key);
                },
                reporter, message.payload, message.category, message.type);
        } catch (const UsageError& usage) {
            std::fprintf(stderr, "mxreport: line %d: %s\n", number, usage.message.c_str());
            ++failures;
        }
    }
    if (throttle) {
        throttle->waitForCompletion();
        // A delivery still running (a daemon slow to answer) ends before the client
        // goes; what is still held is dropped, and said.
        auto dropped = throttle->invalidate();
        throttle.reset();
        std::lock_guard lock(heldMutex);
        for (const auto& key : dropped)
            if (auto found = held.find(key); found != held.end()) {
                std::fprintf(stderr, "mxreport: line %d: not delivered: still held when the wait ended\n",
                             found->second);
                ++failures;
            }
    }
    return failures > 0 ? kExitRefused : 0;
}

std::string humanBytes(double bytes)
{
    const char* units[] = {"B", "KiB", "MiB", "GiB", "TiB"};
    std::size_t unit = 0;
    while (bytes >= 1024 && unit + 1 < std::size(units))
        bytes /= 1024, ++unit;
    return unit == 0 ? fmt::format("{:.0f} B", bytes) : fmt::format("{:.1f} {}", bytes, units[unit]);
}

std::string humanDuration(double seconds)
{
    auto whole = static_cast<std::int64_t>(seconds);
    if (whole < 60)
        return fmt::format("{:.1f} s", seconds);
    if (whole < 3600)
        return fmt::format("{}m {}s", whole / 60, whole % 60);
    return fmt::format("{}h {}m", whole / 3600, whole % 3600 / 60);
}

// A text of the status as one line of itself: process names, collectors' errors and
// the like come from elsewhere and may hold anything.
std::string printable(const std::string& text)
{
    std::string out;
    appendPrintableText(out, text);
    return out;
}

std::string printable(const Value& value) { return printable(value.description()); }

void printStatus(const Dictionary& status)
{
    static const Value nothing;
    auto get = [](const Dictionary& from, const char* key) -> const Value& {
        const Value* value = from.find(key);
        return value ? *value : nothing;
    };
    std::printf("mxreportingd %s, up %s\n", printable(get(status, "version")).c_str(),
                humanDuration(get(status, "uptime_seconds").doubleValue()).c_str());
    const Array* clients = get(status, "clients").asArray();
    std::printf("clients: %zu\n", clients ? clients->size() : 0);
    for (const auto& client : clients ? *clients : Array()) {
        const Dictionary& entry = client.asDictionary() ? *client.asDictionary() : Dictionary();
        double backlog = get(entry, "backlog_bytes").doubleValue();
        std::string unwritten = backlog > 0 ? ", " + humanBytes(backlog) + " not yet written" : "";
        if (get(entry, "held_back").boolValue())
            unwritten += ", held back until it is";
        std::printf("  pid %lld %s (%lld sessions%s)\n", static_cast<long long>(get(entry, "pid").int64Value()),
                    printable(get(entry, "process")).c_str(),
                    static_cast<long long>(get(entry, "sessions").int64Value()), unwritten.c_str());
    }
    std::printf("sessions started: %lld\nreports received: %lld (%.1f/s)\n",
                static_cast<long long>(get(status, "sessions_started").int64Value()),
                static_cast<long long>(get(status, "reports_received").int64Value()),
                get(status, "reports_per_second").doubleValue());
    std::printf("stores:\n");
    if (const Dictionary* stores = get(status, "stores").asDictionary())
        for (const auto& [name, value] : *stores) {
            const Dictionary& store = value.asDictionary() ? *value.asDictionary() : Dictionary();
            std::printf("  %-7s %lld rows written, %lld queued, %s on disk, %lld failed writes\n",
                        printable(name).c_str(), static_cast<long long>(get(store, "rows_written").int64Value()),
                        static_cast<long long>(get(store, "queue_depth").int64Value()),
                        humanBytes(get(store, "bytes").doubleValue()).c_str(),
                        static_cast<long long>(get(store, "failures").int64Value()));
        }
    const Dictionary* exporters = get(status, "exporters").asDictionary();
    std::printf("exporters:%s\n", exporters && !exporters->empty() ? "" : " none (the spool alone)");
    for (const auto& [name, value] : exporters ? *exporters : Dictionary()) {
        const Dictionary& exporter = value.asDictionary() ? *value.asDictionary() : Dictionary();
        std::string error = printable(get(exporter, "last_error"));
        std::printf("  %s: %lld unacknowledged, oldest %s%s%s\n", printable(name).c_str(),
                    static_cast<long long>(get(exporter, "unacknowledged").int64Value()),
                    humanDuration(get(exporter, "oldest_seconds").doubleValue()).c_str(),
                    error.empty() ? "" : ", failing: ", error.c_str());
    }
}

int status(MxReportingClient& client, const std::vector<std::string>& words)
{
    bool json = words.size() == 2 && words[1] == "--json";
    if (words.size() > 1 && !json)
        throw UsageError{"status takes --json"};
    auto result = client.call(method::kStatus, Array());
    if (!result.value || !result.value->asDictionary()) {
        std::fprintf(stderr, "status: %s\n", result.error ? result.error->message.c_str() : "no status in the reply");
        return kExitRefused;
    }
    if (json)
        std::printf("%s\n", toJsonText(*result.value).c_str());
    else
        printStatus(*result.value->asDictionary());
    return 0;
}

// The daemon subscribes to the files present when it starts; a channel added since is
// listed here but sampled only after a restart.
int channels(const std::vector<std::string>& words)
{
    bool json = words.size() == 2 && words[1] == "--json";
    if (words.size() > 1 && !json)
        throw UsageError{"channels takes --json"};
    FileChanstat files(MxReportingPath("run/harmonia/chanstat"));
    if (!json)
        std::printf("%-22s %-28s %-20s %s\n", "DRIVER", "KEY", "VALUE", "FILE");
    for (const auto& driver : MxReportingDriverUtility::drivers()) {
        std::optional<ChanstatError> error;
        auto found = files.copyChannelsInGroup(driver.groupName(), driver.subGroupName(), error);
        std::optional<ChanstatChannels> samples;
        if (found)
            samples = files.createSamples(0, *found, error);
        if (error)
            std::fprintf(stderr, "mxreport: %s: %s\n", driver.description().c_str(),
                         std::generic_category().message(error->code).c_str());
        for (const auto& channel : samples.value_or(ChanstatChannels{})) {
            std::string key = driver.keyPrefix() + channel.name.value_or("");
            if (json)
                std::puts(nlohmann::json{
                    {"driver", driver.description()}, {"key", key}, {"value", channel.value}, {"file", channel.path}}
                              .dump()
                              .c_str());
            else
                std::printf("%-22s %-28s %-20lld %s\n", driver.description().c_str(), key.c_str(),
                            static_cast<long long>(channel.value), channel.path.c_str());
        }
    }
    return 0;
}

// The store views live in a helper of their own, so that this tool does not link
// SQLite: it is replaced by mxreport-stores from the same directory.
std::optional<int> viewStore(const std::vector<std::string>& words)
{
    static const std::vector<std::string> stores = {"events", "power", "sessions", "messages"};
    if (std::find(stores.begin(), stores.end(), words[0]) == stores.end())
        return std::nullopt;
    std::error_code error;
    auto helper = std::filesystem::read_symlink("/proc/self/exe", error).parent_path() / "mxreport-stores";
    std::string program = helper.string();
    std::vector<std::string> copies = words;
    std::vector<char*> arguments{program.data()};
    for (auto& word : copies)
        arguments.push_back(word.data());
    arguments.push_back(nullptr);
    execv(program.c_str(), arguments.data());
    std::fprintf(stderr, "mxreport: cannot run %s: %s\n", program.c_str(),
                 std::generic_category().message(errno).c_str());
    return kExitUnreachable;
}

std::vector<std::vector<std::string>> splitCommands(const std::vector<std::string>& words)
{
    std::vector<std::vector<std::string>> commands(1);
    for (const auto& word : words) {
        if (word == "--") {
            commands.emplace_back();
            continue;
        }
        commands.back().push_back(word);
    }
    std::erase_if(commands, [](const auto& command) { return command.empty(); });
    return commands;
}

int run(int argc, char** argv)
{
    std::vector<std::string> words(argv + 1, argv + argc);
    std::filesystem::path socket = MxReportingClient::defaultSocketPath();
    std::chrono::milliseconds timeout = MxReportingClient::kDefaultTimeout;
    try {
        while (!words.empty() && words[0].starts_with("--") && words[0] != "--") {
            std::string option = words[0];
            words.erase(words.begin());
            if (option == "--help")
                words = {"help"};
            else if (option == "--version")
                words = {"version"};
            else if (option == "--socket" && !words.empty())
                socket = words[0], words.erase(words.begin());
            else if (option == "--timeout" && !words.empty())
                timeout = std::chrono::seconds(parseInteger(words[0], "timeout")), words.erase(words.begin());
            else
                throw UsageError{"unknown option " + option};
        }
        auto commands = splitCommands(words);
        bool help =
            std::any_of(words.begin(), words.end(), [](const auto& word) { return word == "--help" || word == "-h"; });
        if (commands.empty() || help || commands[0][0] == "help") {
            std::fputs(kUsage, commands.empty() ? stderr : stdout);
            return commands.empty() ? kExitUsage : 0;
        }
        if (commands[0][0] == "version") {
            std::puts("mxreport " MXREPORTING_VERSION);
            return 0;
        }
        if (commands[0][0] == "defaults")
            return defaults(commands[0]);
        if (commands[0][0] == "channels")
            return channels(commands[0]);
        if (commands[0][0] == "throttle-key")
            return throttleKey(commands[0]);
        if (commands[0][0] == "notify")
            return notify(commands[0]);
        if (commands[0][0] == "orientation")
            return orientation(commands[0]);
        if (auto status = viewStore(commands[0]))
            return *status;

        std::string error;
        auto client = MxReportingClient::connect(socket, error);
        if (!client) {
            std::fprintf(stderr, "mxreport: %s (is mxreportingd running?)\n", error.c_str());
            return kExitUnreachable;
        }
        client->setTimeout(timeout);
        if (commands[0][0] == "demo")
            return demo(*client);
        if (commands[0][0] == "stream")
            return stream(*client, commands[0]);
        if (commands[0][0] == "status")
            return status(*client, commands[0]);
        Session session(*client);
        for (const auto& command : commands)
            if (!session.run(command))
                return kExitRefused;
        return 0;
    } catch (const UsageError& usage) {
        std::fprintf(stderr, "mxreport: %s\n", usage.message.c_str());
        return kExitUsage;
    }
}

} // namespace

int main(int argc, char** argv)
{
    try {
        return run(argc, argv);
    } catch (const std::exception& error) {
        std::fprintf(stderr, "mxreport: %s\n", error.what());
        return 1;
    }
}
