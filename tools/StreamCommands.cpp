#include "tools/StreamCommands.h"

#include <atomic>
#include <cstdio>
#include <iostream>
#include <map>
#include <mutex>
#include <optional>
#include <syslog.h>

#include <fmt/format.h>

#include "tools/MxReportArguments.h"

namespace mx {

namespace {

// The throttle's lines on stderr, its debug lines only when asked for.
void logToStderr(int priority, const char* line, void* verbose)
{
    if (priority != LOG_DEBUG || *static_cast<bool*>(verbose))
        std::fprintf(stderr, "%s\n", line);
}

std::unique_ptr<MxReportCommand> throttleKey(const Words& words)
{
    if (words.size() < 2 || words.size() % 2 != 0)
        throw UsageError{"throttle-key JSON_OBJECT [--reporter ID] [--category C] [--type T]"};
    auto payload = std::make_shared<mxr::Payload>(payloadOf(parseObject(words[1])));
    std::int64_t reporter = 0;
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
    return std::make_unique<MxReportCommand>(false, [payload, reporter, category, type](MxReportContext&) {
        static bool quiet = false;
        mxr_set_log_function(logToStderr, &quiet);
        std::string key;
        double seconds = 0;
        if (int error = mxr::Throttle::describe(*payload, reporter, category, type, key, seconds); error < 0)
            return failed("throttle-key", error);
        std::printf("%s\n%s\n", key.c_str(), fmt::format("{}", seconds).c_str());
        return kExitDone;
    });
}

// One line of a stream: the message and where it goes.
struct StreamedMessage {
    std::shared_ptr<mxr::Payload> payload;
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
    return {std::make_shared<mxr::Payload>(payloadOf(json["payload"])), parseCategory(code("category")),
            parseMessageType(code("type"))};
}

// What became of each line given to the throttle: delivered, or let go unrun (replaced
// by a later one of its key, or dropped at the end).
class Deliveries {
public:
    void held(int line)
    {
        std::lock_guard lock(mutex_);
        lines_[line] = State{};
    }
    void delivered(int line)
    {
        std::lock_guard lock(mutex_);
        lines_[line].delivered = true;
    }
    void released(int line)
    {
        std::lock_guard lock(mutex_);
        lines_[line].released = true;
    }
    // The lines still held now.
    std::vector<int> stillHeld()
    {
        std::lock_guard lock(mutex_);
        std::vector<int> held;
        for (const auto& [line, state] : lines_)
            if (!state.released)
                held.push_back(line);
        return held;
    }
    bool wasDelivered(int line)
    {
        std::lock_guard lock(mutex_);
        return lines_[line].delivered;
    }

private:
    struct State {
        bool delivered = false;
        bool released = false;
    };
    std::mutex mutex_;
    std::map<int, State> lines_;
};

int streamLines(MxReportContext& context, bool throttled, bool verbose, std::optional<std::vector<std::int64_t>> ids)
{
    static bool verboseLines = false;
    verboseLines = verbose;
    mxr_set_log_function(logToStderr, &verboseLines);
    std::atomic<int> failures{0};
    // Each delivery waits for the daemon's reply: a daemon that does not answer keeps
    // the throttle busy rather than piling requests up.
    auto send = [&context, ids, &failures](const StreamedMessage& message) {
        int error = context.client->send(*message.payload, message.category, message.type, ids);
        if (error < 0) {
            std::fprintf(stderr, "mxreport: send: %s\n",
                         error == -EPERM ? "refused: reporting is off" : mxr::errorText(error).c_str());
            ++failures;
        }
    };
    std::optional<mxr::Throttle> throttle;
    if (throttled)
        throttle.emplace();
    auto deliveries = std::make_shared<Deliveries>();
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
            std::int64_t reporter = ids && !ids->empty() ? ids->front() : 0;
            deliveries->held(number);
            // Released once the throttle is done with it, delivered or not.
            struct Released {
                Released(std::shared_ptr<Deliveries> held, int heldLine) : deliveries(std::move(held)), line(heldLine)
                {
                }
                ~Released() { deliveries->released(line); }
                Released(const Released&) = delete;
                Released& operator=(const Released&) = delete;
                std::shared_ptr<Deliveries> deliveries;
                int line;
            };
            auto released = std::make_shared<Released>(deliveries, number);
            throttle->submit(reporter, *message.payload, message.category, message.type, [send, message, released] {
                send(message);
                released->deliveries->delivered(released->line);
            });
        } catch (const UsageError& usage) {
            std::fprintf(stderr, "mxreport: line %d: %s\n", number, usage.message.c_str());
            ++failures;
        }
    }
    if (throttle) {
        throttle->wait();
        // A delivery still running (a daemon slow to answer) ends before the client
        // goes; what is still held is dropped, and said.
        auto held = deliveries->stillHeld();
        throttle->end();
        for (int number : held)
            if (!deliveries->wasDelivered(number)) {
                std::fprintf(stderr, "mxreport: line %d: not delivered: still held when the wait ended\n", number);
                ++failures;
            }
    }
    return failures > 0 ? kExitRefused : kExitDone;
}

std::unique_ptr<MxReportCommand> stream(const Words& words)
{
    bool throttled = false;
    bool verbose = false;
    std::optional<std::vector<std::int64_t>> ids;
    for (std::size_t i = 1; i < words.size(); ++i) {
        if (words[i] == "--throttle")
            throttled = true;
        else if (words[i] == "-v")
            verbose = true;
        else
            (ids ? *ids : ids.emplace()).push_back(parseInteger(words[i], "reporter ID"));
    }
    return std::make_unique<MxReportCommand>(true, [throttled, verbose, ids](MxReportContext& context) {
        return streamLines(context, throttled, verbose, ids);
    });
}

} // namespace

std::unique_ptr<MxReportCommand> parseStreamCommand(const Words& words)
{
    if (words[0] == "throttle-key")
        return throttleKey(words);
    if (words[0] == "stream")
        return stream(words);
    return nullptr;
}

} // namespace mx
