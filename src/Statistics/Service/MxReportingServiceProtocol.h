#pragma once
// The request protocol that clients call on their connection's endpoint. Every
// operation is asynchronous and answers through its reply callback, following the
// protocol's own rules: a start reply is held until the session is stopped, one
// query may reply twice, `killService` never replies. The connection layer sends the
// first reply of a request and drops any later one.
// Callers: the connection layer's threads.

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/MxReportingVocabulary.h"
#include "platform/Value.h"

namespace mx {

// The one failure a client can see: messages refused while reporting is off.
struct MxReportingError {
    std::string domain;
    std::int64_t code = 0;
    friend bool operator==(const MxReportingError&, const MxReportingError&) = default;
};

inline constexpr const char* kMxReportingErrorDomain = "com.kestrel.audio.reporting";
inline constexpr std::int64_t kMxReportingDisabledErrorCode = 1;

using MxBoolReply = std::function<void(bool)>;
using MxServiceTypeReply = std::function<void(ServiceType)>;
using MxErrorReply = std::function<void(std::optional<MxReportingError>)>;
using MxDictionaryReply = std::function<void(Dictionary)>;
using MxReportersReply = std::function<void(std::vector<ReporterID>)>;

class MxReportingServiceProtocol {
public:
    virtual ~MxReportingServiceProtocol() = default;

    virtual void createReportingSession(ReporterID reporterID, MxBoolReply reply) = 0;
    virtual void setServiceType(ServiceType serviceType, ReporterID reporterID, MxBoolReply reply) = 0;
    virtual void getServiceNameForReporterID(ReporterID reporterID, MxServiceTypeReply reply) = 0;
    virtual void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                                  MxBoolReply reply) = 0;
    virtual void startReportingSessionForID(ReporterID reporterID, MxBoolReply reply) = 0;
    // `reportingIDs` absent: every started session of every client.
    virtual void sendMessage(Dictionary payload, MessageCategory category, MessageType type,
                             std::optional<Array> reportingIDs, MxErrorReply reply) = 0;
    virtual void stopReportingSessionForID(ReporterID reporterID, MxBoolReply reply) = 0;
    virtual void destroyReportingSession(ReporterID reporterID, MxBoolReply reply) = 0;
    // `reporterID:valid:`: replies {"reporterID": ..., "serviceType": ...}.
    virtual void reporterID(ReporterID reporterID, MxDictionaryReply valid) = 0;
    virtual void getAllReporters(MxReportersReply reply) = 0;
    virtual void killService(MxBoolReply reply) = 0;
};

} // namespace mx
