#pragma once
// The reporting vocabulary every part of the daemon speaks: reporter IDs, service
// types, message categories and types, the text names derived from their codes, the
// host application lookup, the internal-build flag and the comparison-exempt keys.
// Pure functions and process-wide constants; callable from any thread.

#include <cstdint>
#include <string>
#include <vector>

#include "value/Value.h"

namespace mx {

using ReporterID = std::int64_t;
using ServiceType = std::uint16_t;
using MessageCategory = std::uint32_t;
using MessageType = std::uint16_t;

namespace service_type {
inline constexpr ServiceType kGeneric = 0;
inline constexpr ServiceType kTelephony = 2;
inline constexpr ServiceType kAlarms = 4;
inline constexpr ServiceType kStandalone = 5;
inline constexpr ServiceType kLongFormAudio = 7;
inline constexpr ServiceType kTest = 11;
inline constexpr ServiceType kAPIUsage = 12;
inline constexpr ServiceType kUnknown = 65535;
} // namespace service_type

namespace message_category {
inline constexpr MessageCategory kDriverStats = 9;
inline constexpr MessageCategory kSummary = 0xFFFFFFFF;
} // namespace message_category

namespace message_type {
inline constexpr MessageType kGeneric = 0;
inline constexpr MessageType kSummary = 0xFFFF;
} // namespace message_type

std::string MxReportingServiceTypeName(ServiceType serviceType);
std::string MxReportingCategoryName(MessageCategory category);
std::string MxReportingMessageTypeName(MessageType type);

// The value under "HostApplicationDisplayID" as stored, or "Unknown".
Value MxReportingHostApplicationID(const Dictionary* userInfo);

// Asked of the device properties once per process, on first use.
bool MxReportingInternalBuild();
// Forgets the cached flag so that a test can install other device properties.
void MxReportingResetInternalBuildForTesting();

// The five keys that never take part in comparing two messages, in their fixed order.
const std::vector<std::string>& MxReportingComparisonExemptKeys();

} // namespace mx
