#pragma once
// Kernel trace points: fixed 32-bit codes that mark the daemon's milestones (request
// handled, session started, ...), each with four argument words, for tracing tools.

#include <cstdint>

#include "platform/ProcessWide.h"

namespace mx {

class TracePoints {
public:
    virtual ~TracePoints() = default;
    // Called on any thread; must not block.
    virtual void emit(std::uint32_t code, std::uint64_t arg1, std::uint64_t arg2, std::uint64_t arg3,
                      std::uint64_t arg4) = 0;
};

// Every trace point of the daemon carries four zero arguments.
inline void MxTrace(std::uint32_t code) { ProcessWide<TracePoints>::get().emit(code, 0, 0, 0, 0); }

} // namespace mx
