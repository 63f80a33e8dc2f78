#include "platform/linux/UsdtTracePoints.h"

#include <sys/sdt.h>

namespace mx {

void UsdtTracePoints::emit(std::uint32_t code, std::uint64_t arg1, std::uint64_t arg2, std::uint64_t arg3,
                           std::uint64_t arg4)
{
    DTRACE_PROBE5(harmonia, trace, code, arg1, arg2, arg3, arg4);
}

} // namespace mx
