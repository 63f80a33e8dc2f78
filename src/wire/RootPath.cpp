#include "wire/RootPath.h"

#include <cstdlib>

namespace mx {

std::filesystem::path MxReportingRoot()
{
    const char* root = std::getenv("MXREPORTING_ROOT");
    return (root && *root) ? std::filesystem::path(root) : std::filesystem::path("/");
}

std::filesystem::path MxReportingPath(const std::filesystem::path& relative)
{
    return MxReportingRoot() / relative.relative_path();
}

} // namespace mx
