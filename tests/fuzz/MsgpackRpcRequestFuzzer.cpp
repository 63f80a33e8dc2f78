// libFuzzer target: arbitrary bytes from a client, cut at arbitrary points, through
// the request decoder, the request parser and the protocol dispatch. Nothing may
// crash, hang or leak; every request that is handed on gets exactly one answer.

#include <cassert>
#include <cstdint>
#include <cstring>

#include "AnsweringService.h"
#include "Statistics/Service/MxReportingRequestDispatch.h"
#include "wire/MsgpackRpcDecoder.h"
#include "wire/MsgpackRpcMessage.h"

namespace {

using namespace mx;

class CountingReply final : public ServiceReply {
public:
    void respond(const Value&) override { ++answers; }
    void fail(const ServiceError&) override { ++answers; }
    void hold() override {}
    int answers = 0;
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    if (size == 0)
        return 0;
    // The first byte picks the read size, so messages are split across reads too.
    std::size_t chunk = 1 + data[0] % 64;
    ++data;
    --size;
    MsgpackRpcDecoder decoder(1 << 16);
    MxReportingRequestDispatch dispatch(std::make_shared<AnsweringService>(false), answerStatus, nullptr);
    for (std::size_t offset = 0; offset < size; offset += chunk) {
        std::size_t count = std::min(chunk, size - offset);
        decoder.feed(reinterpret_cast<const char*>(data + offset), count);
        Value message;
        std::string reason;
        for (;;) {
            auto status = decoder.next(message, reason);
            if (status == MsgpackRpcDecoder::Status::Bad)
                return 0;
            if (status == MsgpackRpcDecoder::Status::NeedMore)
                break;
            auto request = parseRpcRequest(message, reason);
            if (!request)
                return 0;
            auto reply = std::make_shared<CountingReply>();
            dispatch.handleRequest(request->method, request->params ? &*request->params : nullptr, reply);
            if (reply->answers < 1)
                __builtin_trap();
        }
    }
    return 0;
}
