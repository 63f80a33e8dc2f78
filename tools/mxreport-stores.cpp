// mxreport-stores: what mxreportingd's stores hold, read straight from the SQLite
// files under $MXREPORTING_ROOT. mxreport hands its store views to this helper, so
// that mxreport itself needs no SQLite.

#include <cstdio>
#include <string>
#include <vector>

#include "MxReportStoreView.h"
#include "tools/MxReportManualText.h"
#include "wire/RootPath.h"

namespace {

constexpr const char* kUsage = R"(Usage: mxreport-stores STORE [--limit N] [--json]
   or: mxreport-stores --help | --version

Prints what mxreportingd's stores under $MXREPORTING_ROOT/var/lib/harmonia/ hold,
newest last, read straight from their SQLite files (the daemon need not run). Usually
run as "mxreport STORE ...". Reading the stores takes the daemon user's group.

Stores:
  events                            analytics events (tally.db)
  power                             power log events (joule.db)
  sessions                          backend sessions (uplink.db)
  messages                          backend messages (uplink.db)

Options:
  --limit N                         the newest N rows (default 20)
  --json                            one JSON object a line instead of a table

Exit status:
  0                                 printed
  2                                 the store cannot be read
  64                                bad usage

See also:
  mxreport(1), mxreportingd(8)
)";

} // namespace

int main(int argc, char** argv)
{
    std::vector<std::string> words(argv + 1, argv + argc);
    if (words.size() == 1 && (words[0] == "--help" || words[0] == "--help-man")) {
        std::fputs((words[0] == "--help-man" ? mx::manualText(kUsage) : std::string(kUsage)).c_str(), stdout);
        return 0;
    }
    if (words.size() == 1 && words[0] == "--version") {
        std::puts("mxreport-stores " MXREPORTING_VERSION);
        return 0;
    }
    std::string error;
    auto query = mx::parseStoreQuery(words, error);
    if (!query) {
        std::fprintf(stderr, "mxreport: %s\n", error.c_str());
        return 64;
    }
    return mx::printStore(mx::MxReportingPath("var/lib/harmonia"), *query);
}
