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
#include <type_traits>
#include <vector>

#include "Statistics/MxReportingVocabulary.h"
#include "value/Value.h"

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
using MxDictionaryReply = std::function<void(Dictionary)>;
using MxReportersReply = std::function<void(std::vector<ReporterID>)>;

// The reply of a request that the service may refuse whole at one of its limits (the
// sessions it holds, what a period keeps): then nothing of the request is done, and
// instead of a reply of the protocol the client hears which limit it met, from the
// connection layer. No reply of the protocol ever says that.
template <class Result>
class MxRefusableReply {
public:
    using Refusal = std::function<void(const std::string&)>;

    MxRefusableReply() = default;
    // A reply whose refusals nobody needs to hear of.
    template <class F>
    requires(!std::is_same_v<std::decay_t<F>, MxRefusableReply> && std::is_invocable_v<F&, Result>)
        MxRefusableReply(F reply) // NOLINT(bugprone-forwarding-reference-overload)
        : reply_(std::move(reply))
    {
    }
    MxRefusableReply(std::function<void(Result)> reply, Refusal refuse)
        : reply_(std::move(reply)), refuse_(std::move(refuse))
    {
    }

    void operator()(Result result) const
    {
        if (reply_)
            reply_(std::move(result));
    }
    // `limit` says which limit, for the client and the log: "too many sessions on this
    // connection (4096)".
    void refuse(const std::string& limit) const
    {
        if (refuse_)
            refuse_(limit);
    }

private:
    std::function<void(Result)> reply_;
    Refusal refuse_;
};

using MxCreateReply = MxRefusableReply<bool>;
using MxErrorReply = MxRefusableReply<std::optional<MxReportingError>>;

// The reply of a start request, which the session may keep until it is stopped.
// hold() says it is kept: the request's work is done, and the connection no longer
// counts it among the requests waiting for work.
class MxHeldReply {
public:
    MxHeldReply() = default;
    // A reply whose holding nobody needs to hear of.
    template <class F>
    requires(!std::is_same_v<std::decay_t<F>, MxHeldReply> && std::is_invocable_v<F&, bool>)
        MxHeldReply(F reply) // NOLINT(bugprone-forwarding-reference-overload)
        : reply_(std::move(reply))
    {
    }
    MxHeldReply(MxBoolReply reply, std::function<void()> held) : reply_(std::move(reply)), held_(std::move(held)) {}

    void operator()(bool value) const
    {
        if (reply_)
            reply_(value);
    }
    void hold() const
    {
        if (held_)
            held_();
    }

private:
    MxBoolReply reply_;
    std::function<void()> held_;
};

class MxReportingServiceProtocol {
public:
    virtual ~MxReportingServiceProtocol() = default;

    virtual void createReportingSession(ReporterID reporterID, MxCreateReply reply) = 0;
    virtual void setServiceType(ServiceType serviceType, ReporterID reporterID, MxBoolReply reply) = 0;
    virtual void getServiceNameForReporterID(ReporterID reporterID, MxServiceTypeReply reply) = 0;
    virtual void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                                  MxBoolReply reply) = 0;
    virtual void startReportingSessionForID(ReporterID reporterID, MxHeldReply reply) = 0;
    // `reportingIDs` absent: every started session of every client. Its reply waits
    // until what the message left behind is kept, in the stores' pending rows or
    // committed: once it says the message was taken, nothing loses it.
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
