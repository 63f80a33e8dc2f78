#pragma once
// The two msgpack-rpc messages: a request `[0, msgid, method, params]` and a response
// `[1, msgid, error, result]`, read from decoded Values and written to bytes. Shared
// by the daemon and the client library; knows no method of any service.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include <msgpack.hpp>

#include "value/Value.h"

namespace mx {

struct RpcRequest {
    std::uint32_t msgid = 0;
    std::string method;
    std::optional<Array> params; // nothing when the request's parameters are not an array
};

struct RpcResponse {
    std::uint32_t msgid = 0;
    Value error;
    Value result;
};

// The request or response in a decoded message; nothing, with `reason`, when the
// message is not one.
std::optional<RpcRequest> parseRpcRequest(const Value& message, std::string& reason);
std::optional<RpcResponse> parseRpcResponse(const Value& message, std::string& reason);

// Appends one message to `bytes`.
void encodeRpcRequest(msgpack::sbuffer& bytes, std::uint32_t msgid, std::string_view method, const Array& params);
void encodeRpcResponse(msgpack::sbuffer& bytes, std::uint32_t msgid, const Value& error, const Value& result);

} // namespace mx
