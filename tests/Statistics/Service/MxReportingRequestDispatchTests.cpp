#include "Statistics/Service/MxReportingRequestDispatch.h"

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

class RecordingReply final : public ServiceReply {
public:
    void respond(const Value& result) override { results.push_back(result); }
    void fail(const ServiceError& error) override { errors.push_back(error); }
    std::vector<Value> results;
    std::vector<ServiceError> errors;
};

class MxReportingRequestDispatchTest : public ::testing::Test {
protected:
    std::shared_ptr<RecordingReply> dispatch(const std::string& method, std::optional<Array> params)
    {
        auto reply = std::make_shared<RecordingReply>();
        MxReportingRequestDispatch(service).handleRequest(method, params ? &*params : nullptr, reply);
        return reply;
    }

    std::shared_ptr<::testing::StrictMock<MockService>> service =
        std::make_shared<::testing::StrictMock<MockService>>();
};

TEST_F(MxReportingRequestDispatchTest, RequestsThatCannotBeHandedOnAreAnsweredWithAnError)
{
    struct Case {
        std::string method;
        std::optional<Array> params;
        std::int64_t code;
    };
    std::vector<Case> cases = {
        {"unknown:", Array{}, kServiceErrorUnknownMethod},
        {"createReportingSession:reply:", std::nullopt, kServiceErrorBadArguments},
        {"createReportingSession:reply:", Array{}, kServiceErrorBadArguments},
        {"createReportingSession:reply:", Array{"5"}, kServiceErrorBadArguments},
        {"createReportingSession:reply:", Array{18446744073709551615ull}, kServiceErrorBadArguments},
        {"setServiceType:reportingSession:reply:", Array{65536, 1}, kServiceErrorBadArguments},
        {"sendMessage:withCategory:andType:forReportingIDs:reply:", Array{Dictionary{}, -1, 0, nullptr},
         kServiceErrorBadArguments},
        {"sendMessage:withCategory:andType:forReportingIDs:reply:", Array{Dictionary{}, 1, 0, 5},
         kServiceErrorBadArguments},
        {"setConfiguration:forReporterID:reply:", Array{Array{}, 1}, kServiceErrorBadArguments},
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
