// mxreport: the operator's and script's way to talk to mxreportingd, through the
// client library. Every protocol operation, the preferences domain, the notification,
// the orientation feed, the driver channels, the block throttle, the status view and a
// demo session; the store views run as mxreport-stores. A chain of commands joined by
// "--" is parsed and checked whole before any of it runs, and the commands that talk to
// the daemon share one connection.

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <optional>
#include <unistd.h>

#include <fmt/format.h>

#include "tools/DemoCommand.h"
#include "tools/HostCommands.h"
#include "tools/MxReportArguments.h"
#include "tools/MxReportManualText.h"
#include "tools/ProtocolCommands.h"
#include "tools/StatusCommand.h"
#include "tools/StreamCommands.h"
#include "wire/FileOwnership.h"
#include "wire/RootPath.h"

using namespace mx;

namespace {

constexpr const char* kUsage =
    R"(Usage: mxreport [--socket PATH] [--timeout SECONDS] COMMAND [ARGS] [-- COMMAND [ARGS]]...
   or: mxreport --help | --version

Talks to mxreportingd on $MXREPORTING_ROOT/run/harmonia/reporting.sock. Commands joined
by "--" run in order on one connection (a session lives as long as its connection);
the whole chain is checked first, and one bad command runs nothing.

Protocol operations:
  create ID                         createReportingSession
  type ID SERVICE_TYPE              setServiceType (number or name: longformaudio, alarms, ...)
  service-type ID                   getServiceNameForReporterID (prints the number)
  configure ID JSON_OBJECT          setConfiguration
  start ID [--wait]                 startReportingSessionForID (its reply comes at stop);
                                    --wait keeps the connection, and the session, until killed
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
  defaults delete KEY               remove one key
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
                                    in one throttle and waits for the last at end of input.
                                    Last in a chain, it sends into the sessions the chain made

Driver channels (run/harmonia/chanstat/GROUP[/SUBGROUP]/NAME, one integer a file):
  channels [--json]                 the channels of the daemon's four drivers and their
                                    values now, with the key their growth is reported as

  status [--json]                   what the daemon is doing: clients, sessions, reports and
                                    their rate, each store's rows, queue, size and failures,
                                    each exporter's lag and last error

  demo                              play a realistic session and show what happens
  help                              this text

Exit status:
  0                                 done
  1                                 the daemon refused or failed a command
  2                                 the daemon cannot be reached
  64                                bad usage (nothing was done)

See also:
  mxreportingd(8), mxreportingd.conf(5), mxreport-stores(1), mxreporting(3)
)";

struct Options {
    std::string socket = MxReportingPath(kServiceSocketPath).string();
    std::optional<std::int64_t> timeoutSeconds;
};

std::vector<Words> splitChain(const Words& words)
{
    std::vector<Words> chain(1);
    for (const auto& word : words) {
        if (word == "--") {
            chain.emplace_back();
            continue;
        }
        chain.back().push_back(word);
    }
    std::erase_if(chain, [](const Words& command) { return command.empty(); });
    return chain;
}

std::unique_ptr<MxReportCommand> parseCommand(const Words& words)
{
    for (MxReportParser parse :
         {parseProtocolCommand, parseHostCommand, parseStreamCommand, parseStatusCommand, parseDemoCommand})
        if (auto command = parse(words))
            return command;
    throw UsageError{fmt::format("unknown command \"{}\" (see mxreport help)", words[0])};
}

bool isStoreView(const Words& words)
{
    static const Words stores = {"events", "power", "sessions", "messages"};
    return std::find(stores.begin(), stores.end(), words[0]) != stores.end();
}

// The store views are a program of their own, so that this one does not link SQLite:
// it is replaced by mxreport-stores from the same directory.
int viewStore(const Words& words)
{
    std::error_code error;
    auto helper = std::filesystem::read_symlink("/proc/self/exe", error).parent_path() / "mxreport-stores";
    std::string program = helper.string();
    Words copies = words;
    std::vector<char*> arguments{program.data()};
    for (auto& word : copies)
        arguments.push_back(word.data());
    arguments.push_back(nullptr);
    execv(program.c_str(), arguments.data());
    std::fprintf(stderr, "mxreport: cannot run %s: %s\n", program.c_str(),
                 std::generic_category().message(errno).c_str());
    return kExitUnreachable;
}

// What to fix when the daemon cannot be reached: whom the socket lets in, or whether
// anyone listens.
void sayUnreachable(const std::string& socket, int error)
{
    if (auto group = owningGroup(socket); error == -EACCES && !group.empty()) {
        std::fprintf(stderr,
                     "mxreport: permission denied on %s: only its group may connect; add this user to group %s "
                     "(then log in again)\n",
                     socket.c_str(), group.c_str());
        return;
    }
    std::fprintf(stderr, "mxreport: cannot connect to %s: %s\n", socket.c_str(), mxr::errorText(error).c_str());
}

int run(int argc, char** argv)
{
    Words words(argv + 1, argv + argc);
    Options options;
    while (!words.empty() && words[0].starts_with("--") && words[0] != "--") {
        std::string option = words[0];
        words.erase(words.begin());
        if (option == "--help")
            words = {"help"};
        else if (option == "--help-man") {
            std::fputs(manualText(kUsage).c_str(), stdout);
            return kExitDone;
        } else if (option == "--version")
            words = {"version"};
        else if (option == "--socket" && !words.empty())
            options.socket = words[0], words.erase(words.begin());
        else if (option == "--timeout" && !words.empty())
            options.timeoutSeconds = parseInteger(words[0], "timeout"), words.erase(words.begin());
        else
            throw UsageError{"unknown option " + option};
    }
    auto chain = splitChain(words);
    bool help =
        std::any_of(words.begin(), words.end(), [](const auto& word) { return word == "--help" || word == "-h"; });
    if (chain.empty() || help || chain[0][0] == "help") {
        std::fputs(kUsage, chain.empty() ? stderr : stdout);
        return chain.empty() ? kExitUsage : kExitDone;
    }
    if (chain[0][0] == "version") {
        std::puts("mxreport " MXREPORTING_VERSION);
        return kExitDone;
    }
    for (const auto& command : chain)
        if (isStoreView(command) && chain.size() > 1)
            throw UsageError{fmt::format("{} shows a store: it runs alone, not in a chain", command[0])};
    if (isStoreView(chain[0]))
        return viewStore(chain[0]);

    std::vector<std::unique_ptr<MxReportCommand>> commands;
    commands.reserve(chain.size());
    for (const auto& command : chain)
        commands.push_back(parseCommand(command));
    std::optional<mxr::Client> client;
    MxReportContext context;
    if (std::any_of(commands.begin(), commands.end(), [](const auto& command) { return command->usesConnection(); })) {
        client.emplace(options.socket.c_str());
        if (!client->open()) {
            sayUnreachable(options.socket, client->error());
            return kExitUnreachable;
        }
        if (options.timeoutSeconds)
            client->setTimeout(std::chrono::seconds(*options.timeoutSeconds));
        context.client = &*client;
    }
    for (const auto& command : commands)
        if (int status = command->run(context); status != kExitDone)
            return status;
    return kExitDone;
}

} // namespace

int main(int argc, char** argv)
{
    try {
        return run(argc, argv);
    } catch (const UsageError& usage) {
        std::fprintf(stderr, "mxreport: %s\n", usage.message.c_str());
        return kExitUsage;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "mxreport: %s\n", error.what());
        return kExitRefused;
    }
}
