#include "tools/ProtocolCommands.h"

#include <csignal>
#include <cstdio>
#include <optional>
#include <unistd.h>

#include <fmt/format.h>

#include "tools/MxReportArguments.h"

namespace mx {

namespace {

std::unique_ptr<MxReportCommand> command(MxReportCommand::Run run)
{
    return std::make_unique<MxReportCommand>(true, std::move(run));
}

// Prints "COMMAND: true" for an operation the daemon answers true.
int answered(const std::string& command, int error)
{
    if (error < 0)
        return failed(command, error);
    std::printf("%s: true\n", command.c_str());
    return kExitDone;
}

using SessionCall = int (mxr::Client::*)(std::int64_t);

std::unique_ptr<MxReportCommand> sessionCommand(const Words& words, SessionCall call)
{
    std::int64_t id = parseInteger(argument(words, 1), "reporter ID");
    return command(
        [name = words[0], id, call](MxReportContext& context) { return answered(name, (context.client->*call)(id)); });
}

// Its reply is held by the daemon until the session stops, and kept by the library;
// with --wait the chain holds its connection, and so the session, until it is ended.
std::unique_ptr<MxReportCommand> start(const Words& words)
{
    std::int64_t id = parseInteger(argument(words, 1), "reporter ID");
    bool wait = words.size() > 2 && words[2] == "--wait";
    if (words.size() > (wait ? 3 : 2))
        throw UsageError{"start ID [--wait]"};
    return command([id, wait](MxReportContext& context) {
        if (int error = context.client->startSession(id); error < 0)
            return failed("start", error);
        std::printf("start %lld: sent, its reply is held until the session stops\n", static_cast<long long>(id));
        std::fflush(stdout);
        if (!wait)
            return kExitDone;
        for (;;)
            pause();
    });
}

std::unique_ptr<MxReportCommand> send(const Words& words)
{
    if (words.size() < 4)
        throw UsageError{"send needs a JSON object, a category and a type"};
    auto payload = std::make_shared<mxr::Payload>(payloadOf(parseObject(words[1])));
    MessageCategory category = parseCategory(words[2]);
    MessageType type = parseMessageType(words[3]);
    std::optional<std::vector<std::int64_t>> ids;
    for (std::size_t i = 4; i < words.size(); ++i) {
        if (!ids)
            ids.emplace();
        if (words[i] != "--none")
            ids->push_back(parseInteger(words[i], "reporter ID"));
    }
    return command([payload, category, type, ids](MxReportContext& context) {
        int error = context.client->send(*payload, category, type, ids);
        if (error == -EPERM) {
            std::printf("send: refused: domain com.kestrel.audio.reporting code 1 (reporting is switched off)\n");
            return kExitRefused;
        }
        if (error < 0)
            return failed("send", error);
        std::printf("send: accepted\n");
        return kExitDone;
    });
}

std::unique_ptr<MxReportCommand> serviceType(const Words& words)
{
    std::int64_t id = parseInteger(argument(words, 1), "reporter ID");
    return command([id](MxReportContext& context) {
        int type = context.client->serviceType(id);
        if (type < 0)
            return failed("service-type", type);
        std::printf("service-type: %d (%s)\n", type, MxReportingServiceTypeName(ServiceType(type)).c_str());
        return kExitDone;
    });
}

std::unique_ptr<MxReportCommand> valid(const Words& words)
{
    std::int64_t id = parseInteger(argument(words, 1), "reporter ID");
    return command([id](MxReportContext& context) {
        std::uint16_t type = 0;
        int found = context.client->isValid(id, type);
        if (found < 0)
            return failed("valid", found);
        std::printf("valid: {\"reporterID\":%lld,\"serviceType\":%d}\n", static_cast<long long>(found ? id : 0), type);
        return kExitDone;
    });
}

std::unique_ptr<MxReportCommand> reporters()
{
    return command([](MxReportContext& context) {
        std::vector<std::int64_t> ids;
        if (int error = context.client->reporters(ids); error < 0)
            return failed("reporters", error);
        std::printf("reporters: [%s]\n", fmt::format("{}", fmt::join(ids, ",")).c_str());
        return kExitDone;
    });
}

std::unique_ptr<MxReportCommand> kill()
{
    return command([](MxReportContext& context) {
        if (int error = context.client->killService(); error < 0)
            return failed("kill", error);
        std::puts("kill: sent (the daemon exits with status 2)");
        return kExitDone;
    });
}

} // namespace

std::unique_ptr<MxReportCommand> parseProtocolCommand(const Words& words)
{
    const std::string& name = words[0];
    if (name == "create")
        return sessionCommand(words, &mxr::Client::createSession);
    if (name == "type") {
        std::int64_t id = parseInteger(argument(words, 1), "reporter ID");
        ServiceType type = parseServiceType(argument(words, 2));
        return command([id, type](MxReportContext& context) {
            return answered("type", context.client->setServiceType(id, type));
        });
    }
    if (name == "service-type")
        return serviceType(words);
    if (name == "configure") {
        std::int64_t id = parseInteger(argument(words, 1), "reporter ID");
        auto configuration = std::make_shared<mxr::Payload>(payloadOf(parseObject(argument(words, 2))));
        return command([id, configuration](MxReportContext& context) {
            return answered("configure", context.client->setConfiguration(id, *configuration));
        });
    }
    if (name == "start")
        return start(words);
    if (name == "send")
        return send(words);
    if (name == "stop")
        return sessionCommand(words, &mxr::Client::stopSession);
    if (name == "destroy")
        return sessionCommand(words, &mxr::Client::destroySession);
    if (name == "valid")
        return valid(words);
    if (name == "reporters")
        return reporters();
    if (name == "kill")
        return kill();
    return nullptr;
}

} // namespace mx
