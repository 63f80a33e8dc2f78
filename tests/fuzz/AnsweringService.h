#pragma once
// The reporting protocol answered at once, for the fuzz targets: what matters there
// is the way to and from the service, not what it does. The double reply and the
// held start reply of the real service are available, for targets that check the
// connection's handling of them.

#include <functional>

#include "Statistics/Service/MxReportingServiceProtocol.h"

namespace mx {

class AnsweringService final : public MxReportingServiceProtocol {
public:
    explicit AnsweringService(bool likeTheService) : likeTheService_(likeTheService) {}

    void createReportingSession(ReporterID, MxCreateReply reply) override { reply(true); }
    void setServiceType(ServiceType, ReporterID, MxBoolReply reply) override { reply(true); }
    void getServiceNameForReporterID(ReporterID, MxServiceTypeReply reply) override
    {
        reply(65535);
        if (likeTheService_)
            reply(65535);
    }
    void setConfiguration(std::optional<Dictionary>, ReporterID, MxBoolReply reply) override { reply(true); }
    void startReportingSessionForID(ReporterID, MxHeldReply reply) override
    {
        if (!likeTheService_)
            reply(true);
    }
    void sendMessage(Dictionary payload, MessageCategory, MessageType, std::optional<Array>,
                     MxErrorReply reply) override
    {
        (void)Value(payload).description();
        reply(std::nullopt);
    }
    void stopReportingSessionForID(ReporterID, MxBoolReply reply) override { reply(true); }
    void destroyReportingSession(ReporterID, MxBoolReply reply) override { reply(true); }
    void reporterID(ReporterID, MxDictionaryReply valid) override { valid(Dictionary{{"reporterID", 0}}); }
    void getAllReporters(MxReportersReply reply) override { reply({}); }
    void killService(MxBoolReply reply) override { reply(false); } // the real one exits

private:
    bool likeTheService_;
};

inline void answerStatus(std::function<void(Dictionary)> reply) { reply(Dictionary{{"version", "fuzz"}}); }

} // namespace mx
