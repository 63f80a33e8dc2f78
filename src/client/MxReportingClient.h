#pragma once
// The client library of the reporting service: one connection to the daemon's
// socket, with one call per protocol operation in two forms. The asynchronous form
// takes a callback, run once on the client's I/O thread with the reply or an error;
// any number of requests may be in flight. The synchronous form waits for the reply
// (never call it from inside a callback), and the client is never destroyed from
// inside one. Thread-safe.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "Statistics/MxReportingVocabulary.h"
#include "value/Value.h"

namespace mx {

struct MxClientError {
    enum class Kind {
        Disconnected, // the connection is gone (or never was)
        Rpc,          // the daemon could not hand the request on (unknown method, bad arguments)
        Timeout,      // no reply in time (synchronous calls)
        Protocol,     // a reply of the wrong shape
    };
    Kind kind = Kind::Disconnected;
    std::int64_t code = 0;
    std::string message;
};

template <class T>
struct MxClientResult {
    std::optional<T> value;
    std::optional<MxClientError> error;
    explicit operator bool() const { return value.has_value(); }
};

// The reply of sendMessage: nothing, or the refusal {"domain", "code"} while
// reporting is off.
struct MxSendRefusal {
    std::string domain;
    std::int64_t code = 0;
};
using MxSendOutcome = std::optional<MxSendRefusal>;

class MxReportingClient {
public:
    template <class T>
    using Callback = std::function<void(MxClientResult<T>)>;

    static constexpr std::chrono::seconds kDefaultTimeout{10};

    // The daemon's socket under $MXREPORTING_ROOT.
    static std::filesystem::path defaultSocketPath();
    // Nothing, with `error`, when the socket cannot be reached.
    static std::unique_ptr<MxReportingClient> connect(const std::filesystem::path& socket, std::string& error);
    ~MxReportingClient();

    void setTimeout(std::chrono::milliseconds timeout) { timeout_ = timeout; }

    // Asynchronous forms.
    void createReportingSession(ReporterID reporterID, Callback<bool> done);
    void setServiceType(ServiceType serviceType, ReporterID reporterID, Callback<bool> done);
    void getServiceNameForReporterID(ReporterID reporterID, Callback<ServiceType> done);
    void setConfiguration(const std::optional<Dictionary>& configuration, ReporterID reporterID, Callback<bool> done);
    // The reply comes only when the session is stopped (or started again).
    void startReportingSessionForID(ReporterID reporterID, Callback<bool> done);
    void sendMessage(const Dictionary& payload, MessageCategory category, MessageType type,
                     const std::optional<std::vector<ReporterID>>& reportingIDs, Callback<MxSendOutcome> done);
    void stopReportingSessionForID(ReporterID reporterID, Callback<bool> done);
    void destroyReportingSession(ReporterID reporterID, Callback<bool> done);
    void reporterID(ReporterID reporterID, Callback<Dictionary> valid);
    void getAllReporters(Callback<std::vector<ReporterID>> done);
    // No reply ever comes: the daemon exits.
    void killService();

    // Synchronous forms.
    MxClientResult<bool> createReportingSession(ReporterID reporterID);
    MxClientResult<bool> setServiceType(ServiceType serviceType, ReporterID reporterID);
    MxClientResult<ServiceType> getServiceNameForReporterID(ReporterID reporterID);
    MxClientResult<bool> setConfiguration(const std::optional<Dictionary>& configuration, ReporterID reporterID);
    MxClientResult<bool> stopReportingSessionForID(ReporterID reporterID);
    MxClientResult<bool> destroyReportingSession(ReporterID reporterID);
    MxClientResult<MxSendOutcome> sendMessage(const Dictionary& payload, MessageCategory category, MessageType type,
                                              const std::optional<std::vector<ReporterID>>& reportingIDs);
    MxClientResult<Dictionary> reporterID(ReporterID reporterID);
    MxClientResult<std::vector<ReporterID>> getAllReporters();

    // Any method with any parameters: the raw result, for tools and tests.
    void call(std::string_view method, const Array& params, Callback<Value> done);
    MxClientResult<Value> call(std::string_view method, const Array& params);

private:
    class Connection;
    explicit MxReportingClient(std::unique_ptr<Connection> connection);

    template <class T>
    MxClientResult<T> wait(const std::function<void(Callback<T>)>& start);

    std::unique_ptr<Connection> connection_;
    std::chrono::milliseconds timeout_ = kDefaultTimeout;
};

} // namespace mx
