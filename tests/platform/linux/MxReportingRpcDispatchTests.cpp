#include "platform/linux/MxReportingRpcDispatch.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Statistics/Service/MxReportingServiceProtocol.h"

namespace mx {
namespace {


class MockService : public MxReportingServiceProtocol {
public:
    MOCK_METHOD(void, createReportingSession, (ReporterID, MxBoolReply), (override));
    MOCK_METHOD(void, setServiceType, (ServiceType, ReporterID, MxBoolReply), (override));
    MOCK_METHOD(void, getServiceNameForReporterID, (ReporterID, MxServiceTypeReply), (override));
    MOCK_METHOD(void, setConfiguration, (std::optional<Dictionary>, ReporterID, MxBoolReply), (override));
    MOCK_METHOD(void, startReportingSessionForID, (ReporterID, MxBoolReply), (override));
    MOCK_METHOD(void, sendMessage, (Dictionary, MessageCategory, MessageType, std::optional<Array>, MxErrorReply),
                (override));
    MOCK_METHOD(void, stopReportingSessionForID, (ReporterID, MxBoolReply), (override));
    MOCK_METHOD(void, destroyReportingSession, (ReporterID, MxBoolReply), (override));
    MOCK_METHOD(void, reporterID, (ReporterID, MxDictionaryReply), (override));
    MOCK_METHOD(void, getAllReporters, (MxReportersReply), (override));
    MOCK_METHOD(void, killService, (MxBoolReply), (override));
};

class RecordingResponder final : public RpcResponder {
public:
    void respond(const Value& result) override { results.push_back(result); }
    void fail(const RpcError& error) override { errors.push_back(error); }
    std::vector<Value> results;
    std::vector<RpcError> errors;
};

class MxReportingRpcDispatchTest : public ::testing::Test {
protected:
    std::shared_ptr<RecordingResponder> dispatch(const std::string& method, std::optional<Array> params)
    {
        auto responder = std::make_shared<RecordingResponder>();
        dispatchReportingRequest(service, RpcRequest{1, method, std::move(params)}, responder);
        return responder;
    }

    ::testing::StrictMock<MockService> service;
};

TEST_F(MxReportingRpcDispatchTest, RequestsThatCannotBeHandedOnAreAnsweredWithAnError)
{
    struct Case {
        std::string method;
        std::optional<Array> params;
        std::int64_t code;
    };
    std::vector<Case> cases = {
        {"unknown:", Array{}, kRpcErrorUnknownMethod},
        {"createReportingSession:reply:", std::nullopt, kRpcErrorBadArguments},
        {"createReportingSession:reply:", Array{}, kRpcErrorBadArguments},
        {"createReportingSession:reply:", Array{"5"}, kRpcErrorBadArguments},
        {"createReportingSession:reply:", Array{18446744073709551615ull}, kRpcErrorBadArguments},
        {"setServiceType:reportingSession:reply:", Array{65536, 1}, kRpcErrorBadArguments},
        {"sendMessage:withCategory:andType:forReportingIDs:reply:", Array{Dictionary{}, -1, 0, nullptr},
         kRpcErrorBadArguments},
        {"sendMessage:withCategory:andType:forReportingIDs:reply:", Array{Dictionary{}, 1, 0, 5}, kRpcErrorBadArguments},
        {"setConfiguration:forReporterID:reply:", Array{Array{}, 1}, kRpcErrorBadArguments},
    };
    for (const auto& request : cases) {
        auto responder = dispatch(request.method, request.params);
        ASSERT_EQ(responder->errors.size(), 1u) << request.method;
        EXPECT_EQ(responder->errors[0].code, request.code) << responder->errors[0].message;
        EXPECT_TRUE(responder->results.empty());
    }
}

} // namespace
} // namespace mx
