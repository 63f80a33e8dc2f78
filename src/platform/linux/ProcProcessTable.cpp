#include "platform/linux/ProcProcessTable.h"

#include <fstream>
#include <unistd.h>

namespace mx {

std::optional<std::string> ProcProcessTable::processName(pid_t pid)
{
    if (pid < 1)
        return std::nullopt;
    std::ifstream comm("/proc/" + std::to_string(pid) + "/comm");
    std::string name;
    if (!comm || !std::getline(comm, name))
        return std::nullopt;
    return name;
}

pid_t ProcProcessTable::ownProcessIdentifier() { return getpid(); }

std::string ProcProcessTable::ownProcessName() { return processName(getpid()).value_or(""); }

} // namespace mx
