#include "wire/MsgpackRpcDecoder.h"
#include "wire/MsgpackRpcMessage.h"

#include <gtest/gtest.h>

#include "wire/MsgpackValue.h"

namespace mx {
namespace {

std::string encode(const Value& value)
{
    msgpack::sbuffer buffer;
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    encodeMsgpack(packer, value);
    return std::string(buffer.data(), buffer.size());
}

Value nested(int depth)
{
    Value value = 1;
    for (int i = 1; i < depth; ++i)
        value = Array{value};
    return value;
}

TEST(MsgpackRpcDecoderTest, PipelinedRequestsSplitAcrossReadsComeOutWholeAndInOrder)
{
    std::string stream;
    for (std::uint32_t msgid = 1; msgid <= 3; ++msgid)
        stream += encode(Array{0, msgid, "reporterID:valid:", Array{std::int64_t(msgid) * 10}});
    MsgpackRpcDecoder decoder;
    std::vector<std::uint32_t> seen;
    Value message;
    std::string reason;
    for (char byte : stream) {
        decoder.feed(&byte, 1);
        while (decoder.next(message, reason) == MsgpackRpcDecoder::Status::Message) {
            auto request = parseRpcRequest(message, reason);
            ASSERT_TRUE(request) << reason;
            EXPECT_EQ((*request->params)[0], Value(std::int64_t(request->msgid) * 10));
            seen.push_back(request->msgid);
        }
    }
    EXPECT_EQ(seen, (std::vector<std::uint32_t>{1, 2, 3}));
}

TEST(MsgpackRpcDecoderTest, EveryValueKindSurvivesTheWire)
{
    Dictionary payload{{"nil", nullptr},
                       {"bool", true},
                       {"negative", -5},
                       {"big", 18446744073709551615ull},
                       {"double", 2.5},
                       {"text", "héllo"},
                       {"data", Data{1, 2, 3}},
                       {"date", Date(std::chrono::seconds(1700000000) + std::chrono::nanoseconds(42))},
                       {"old date", Date(std::chrono::seconds(-86400))},
                       {"list", Array{1, "a"}}};
    MsgpackRpcDecoder decoder;
    auto bytes = encode(payload);
    decoder.feed(bytes.data(), bytes.size());
    Value message;
    std::string reason;
    ASSERT_EQ(decoder.next(message, reason), MsgpackRpcDecoder::Status::Message) << reason;
    EXPECT_EQ(message, Value(payload));
}

TEST(MsgpackRpcDecoderTest, InputBeyondTheLimitsIsRefusedWithItsReason)
{
    struct Case {
        std::string bytes;
        std::string reason;
    };
    std::vector<Case> cases = {
        {encode(nested(64)), ""},
        {encode(nested(65)), "nesting deeper than 64"},
        {std::string("\x81\x01\x02", 3), "map key is not a string"},
        {std::string("\xd4\x05\x00", 3), "extension type 5 is not a date"},
        {std::string("\xc1", 1), "malformed MessagePack"},
        {std::string("\xdb\x00\x20\x00\x00", 5) + std::string((1 << 20) + 1, 'x'), "message larger than 1 MiB"},
        // Declared sizes are refused at their header, before anything arrives or is
        // reserved: a 5 MiB string, and arrays claiming billions of elements.
        {std::string("\xdb\x00\x50\x00\x00", 5), "message larger than 1 MiB (a header declares 5242880 bytes)"},
        {std::string("\x91\xdd\xff\xff\xff\xff", 6),
         "message larger than 1 MiB (a header declares 4294967295 elements)"},
        {std::string("\xdf\x00\x08\x00\x00", 5), "message larger than 1 MiB (a header declares 1048576 elements)"},
        {std::string("\xc7\xff\x05", 3) + std::string(255, 'x'), "extension type 5 is not a date"},
    };
    for (const auto& input : cases) {
        MsgpackRpcDecoder decoder;
        decoder.feed(input.bytes.data(), input.bytes.size());
        Value message;
        std::string reason;
        auto status = decoder.next(message, reason);
        if (input.reason.empty()) {
            EXPECT_EQ(status, MsgpackRpcDecoder::Status::Message) << reason;
        } else {
            EXPECT_EQ(status, MsgpackRpcDecoder::Status::Bad) << input.reason;
            EXPECT_EQ(reason.substr(0, input.reason.size()), input.reason);
        }
    }
}

TEST(MsgpackRpcDecoderTest, OnlyWellFormedRequestsAndResponsesParse)
{
    std::string reason;
    EXPECT_FALSE(parseRpcRequest(Array{0, 1, "m"}, reason));
    EXPECT_FALSE(parseRpcRequest(Array{1, 1, "m", Array{}}, reason));
    EXPECT_FALSE(parseRpcRequest(Array{0, -1, "m", Array{}}, reason));
    EXPECT_FALSE(parseRpcRequest(Array{0, 1, 7, Array{}}, reason));
    auto request = parseRpcRequest(Array{0, 4294967295ll, "m", "not an array"}, reason);
    ASSERT_TRUE(request);
    EXPECT_EQ(request->msgid, 4294967295u);
    EXPECT_FALSE(request->params) << "answered with an RPC error, not a closed connection";
    auto response = parseRpcResponse(Array{1, 9, nullptr, true}, reason);
    ASSERT_TRUE(response);
    EXPECT_EQ(response->result, Value(true));
}

} // namespace
} // namespace mx
