// mxreport-stores: what mxreportingd's stores hold, read straight from the SQLite
// files under $MXREPORTING_ROOT. mxreport hands its store views to this helper, so
// that mxreport itself needs no SQLite.

#include <cstdio>
#include <string>
#include <vector>

#include "MxReportStoreView.h"
#include "wire/RootPath.h"

int main(int argc, char** argv)
{
    std::vector<std::string> words(argv + 1, argv + argc);
    std::string error;
    auto query = mx::parseStoreQuery(words, error);
    if (!query) {
        std::fprintf(stderr, "mxreport: %s\n", error.c_str());
        return 64;
    }
    return mx::printStore(mx::MxReportingPath("var/lib/harmonia"), *query);
}
