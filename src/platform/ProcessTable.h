#pragma once
// The kernel's process table: what a client process is called.

#include <optional>
#include <string>
#include <sys/types.h>

#include "platform/ProcessWide.h"

namespace mx {

class ProcessTable {
public:
    virtual ~ProcessTable() = default;
    // The short command name the kernel records for `pid`, or nothing when the
    // process is gone or cannot be read. Callable from any thread.
    virtual std::optional<std::string> processName(pid_t pid) = 0;
    virtual pid_t ownProcessIdentifier() = 0;
    virtual std::string ownProcessName() = 0;
};

} // namespace mx
