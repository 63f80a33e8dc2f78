#pragma once
// Process names from /proc/PID/comm.

#include "platform/ProcessTable.h"

namespace mx {

class ProcProcessTable final : public ProcessTable {
public:
    std::optional<std::string> processName(pid_t pid) override;
    pid_t ownProcessIdentifier() override;
    std::string ownProcessName() override;
};

} // namespace mx
