#include "wire/MsgpackRpcMessage.h"

#include "wire/MsgpackValue.h"

namespace mx {

namespace {

const Array* messageArray(const Value& message, std::size_t size, std::int64_t type, std::string& reason)
{
    const Array* array = message.asArray();
    if (!array || array->size() != size || (*array)[0].kind() != Value::Kind::Int || *(*array)[0].asInt() != type) {
        reason = type == 0 ? "not a msgpack-rpc request" : "not a msgpack-rpc response";
        return nullptr;
    }
    const Value& msgid = (*array)[1];
    if (msgid.kind() != Value::Kind::Int || *msgid.asInt() < 0 || *msgid.asInt() > std::int64_t(UINT32_MAX)) {
        reason = "message id is not an unsigned 32-bit integer";
        return nullptr;
    }
    return array;
}

} // namespace

std::optional<RpcRequest> parseRpcRequest(const Value& message, std::string& reason)
{
    const Array* array = messageArray(message, 4, 0, reason);
    if (!array)
        return std::nullopt;
    const std::string* method = (*array)[2].asString();
    if (!method) {
        reason = "method name is not a string";
        return std::nullopt;
    }
    RpcRequest request{static_cast<std::uint32_t>(*(*array)[1].asInt()), *method, std::nullopt};
    // Parameters that are not an array are the request's own problem, answered with
    // an error; the connection stays usable.
    if (const Array* params = (*array)[3].asArray())
        request.params = *params;
    return request;
}

std::optional<RpcResponse> parseRpcResponse(const Value& message, std::string& reason)
{
    const Array* array = messageArray(message, 4, 1, reason);
    if (!array)
        return std::nullopt;
    return RpcResponse{static_cast<std::uint32_t>(*(*array)[1].asInt()), (*array)[2], (*array)[3]};
}

void encodeRpcRequest(msgpack::sbuffer& bytes, std::uint32_t msgid, std::string_view method, const Array& params)
{
    msgpack::packer<msgpack::sbuffer> packer(bytes);
    packer.pack_array(4);
    packer.pack_uint8(0);
    packer.pack_uint32(msgid);
    packer.pack_str(static_cast<std::uint32_t>(method.size()));
    packer.pack_str_body(method.data(), static_cast<std::uint32_t>(method.size()));
    encodeMsgpack(packer, params);
}

void encodeRpcResponse(msgpack::sbuffer& bytes, std::uint32_t msgid, const Value& error, const Value& result)
{
    msgpack::packer<msgpack::sbuffer> packer(bytes);
    packer.pack_array(4);
    packer.pack_uint8(1);
    packer.pack_uint32(msgid);
    encodeMsgpack(packer, error);
    encodeMsgpack(packer, result);
}

} // namespace mx
