#pragma once
// What the benchmarks send: the report of a playing audio engine, nine keys of every
// kind a component sends (numbers, texts, a real, an engine-on time and a timestamp),
// and a session to send it to.

#include <cstdint>
#include <random>

#include <mxreporting/mxreporting.hpp>

#include "value/Value.h"

namespace mx::bench {

inline constexpr std::int32_t kReportCategory = 0x08000003;
inline constexpr std::int32_t kReportType = 1;

// The report numbered `seq`; its "seq" key carries the number.
Dictionary benchReport(std::mt19937& random, int seq);
// The same report as the client library takes it.
mxr::Payload payloadOf(const Dictionary& dictionary);
// Creates, configures and starts the session of reporter `id` on `client`.
void startBenchSession(mxr::Client& client, std::int64_t id);

} // namespace mx::bench
