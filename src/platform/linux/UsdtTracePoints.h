#pragma once
// Trace points as the USDT probe harmonia:trace (code and four argument words), for
// bpftrace, perf or SystemTap. A probe nobody attached to costs one no-op.

#include "platform/TracePoints.h"

namespace mx {

class UsdtTracePoints final : public TracePoints {
public:
    void emit(std::uint32_t code, std::uint64_t arg1, std::uint64_t arg2, std::uint64_t arg3,
              std::uint64_t arg4) override;
};

} // namespace mx
