#pragma once
// The method names of the reporting service on the wire: each operation's full
// keyword name, exactly as clients send it. The one table both ends use: the daemon
// binds each name to its operation, the client library calls by these names.

#include <string_view>

namespace mx::method {

inline constexpr std::string_view kCreateReportingSession = "createReportingSession:reply:";
inline constexpr std::string_view kSetServiceType = "setServiceType:reportingSession:reply:";
inline constexpr std::string_view kGetServiceNameForReporterID = "getServiceNameForReporterID:reply:";
inline constexpr std::string_view kSetConfiguration = "setConfiguration:forReporterID:reply:";
inline constexpr std::string_view kStartReportingSessionForID = "startReportingSessionForID:reply:";
inline constexpr std::string_view kSendMessage = "sendMessage:withCategory:andType:forReportingIDs:reply:";
inline constexpr std::string_view kStopReportingSessionForID = "stopReportingSessionForID:reply:";
inline constexpr std::string_view kDestroyReportingSession = "destroyReportingSession:reply:";
inline constexpr std::string_view kReporterIDValid = "reporterID:valid:";
inline constexpr std::string_view kGetAllReporters = "getAllReporters:";
inline constexpr std::string_view kKillService = "killService:";
// Outside the reporting protocol: the daemon's counters, for operators.
inline constexpr std::string_view kStatus = "status";

} // namespace mx::method
