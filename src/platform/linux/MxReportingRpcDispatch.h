#pragma once
// Turns one msgpack-rpc request into a call of the reporting protocol: the method is
// the operation's full keyword name, the parameters its arguments in order (without
// the reply). Requests that cannot be handed on (unknown method, wrong number or
// types of arguments) are answered with an RPC error at once.

#include <cstdint>
#include <memory>
#include <string>

#include "platform/Value.h"
#include "platform/linux/MsgpackRpcDecoder.h"

namespace mx {

class MxReportingServiceProtocol;

inline constexpr std::int64_t kRpcErrorUnknownMethod = 1;
inline constexpr std::int64_t kRpcErrorBadArguments = 2;

struct RpcError {
    std::int64_t code = 0;
    std::string message;
};

// The way back to the client for one request. Callable from any thread, any number
// of times: the first reply is sent, later ones are dropped.
class RpcResponder {
public:
    virtual ~RpcResponder() = default;
    virtual void respond(const Value& result) = 0;
    virtual void fail(const RpcError& error) = 0;
};

void dispatchReportingRequest(MxReportingServiceProtocol& service, const RpcRequest& request,
                              const std::shared_ptr<RpcResponder>& responder);

} // namespace mx
