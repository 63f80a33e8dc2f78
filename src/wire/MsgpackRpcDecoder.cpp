#include "wire/MsgpackRpcDecoder.h"

#include <cstring>

#include "wire/MsgpackValue.h"

namespace mx {

namespace {

// No element count may exceed what fits in one message: a forged container header
// then cannot make the unpacker reserve more than that.
msgpack::unpack_limit limitsFor(std::size_t maximumMessageBytes)
{
    return msgpack::unpack_limit(maximumMessageBytes, maximumMessageBytes / 2, maximumMessageBytes, maximumMessageBytes,
                                 maximumMessageBytes, kMsgpackMaximumDepth);
}

// An idle connection costs this much; a busy one grows its buffer as it needs.
constexpr std::size_t kInitialBufferBytes = std::size_t{8} * 1024;

} // namespace

MsgpackRpcDecoder::MsgpackRpcDecoder(std::size_t maximumMessageBytes)
    : maximumMessageBytes_(maximumMessageBytes),
      unpacker_(nullptr, nullptr, kInitialBufferBytes, limitsFor(maximumMessageBytes)),
      guard_(maximumMessageBytes, kMsgpackMaximumDepth)
{
}

std::span<char> MsgpackRpcDecoder::buffer(std::size_t atLeast)
{
    unpacker_.reserve_buffer(atLeast);
    return {unpacker_.buffer(), unpacker_.buffer_capacity()};
}

void MsgpackRpcDecoder::consumed(std::size_t count)
{
    if (guardReason_.empty() && !guard_.check({unpacker_.buffer(), count}, guardReason_) && guardReason_.empty())
        guardReason_ = "malformed MessagePack";
    unpacker_.buffer_consumed(count);
}

void MsgpackRpcDecoder::feed(const char* bytes, std::size_t count)
{
    auto space = buffer(count);
    std::memcpy(space.data(), bytes, count);
    consumed(count);
}

MsgpackRpcDecoder::Status MsgpackRpcDecoder::next(Value& message, std::string& reason)
{
    if (!guardReason_.empty()) {
        reason = guardReason_;
        return Status::Bad;
    }
    msgpack::object_handle handle;
    // The unpacker counts the bytes of a message that spans several reads in
    // parsed_size() until the message completes, and then starts again at zero.
    std::size_t partial = unpacker_.parsed_size();
    std::size_t pending = unpacker_.nonparsed_size();
    bool complete = false;
    try {
        complete = unpacker_.next(handle);
    } catch (const msgpack::depth_size_overflow&) {
        reason = "nesting deeper than 64";
        return Status::Bad;
    } catch (const msgpack::size_overflow&) {
        reason = "message larger than 1 MiB";
        return Status::Bad;
    } catch (const std::exception& error) {
        reason = std::string("malformed MessagePack (") + error.what() + ")";
        return Status::Bad;
    }
    if (!complete) {
        if (unpacker_.nonparsed_size() > maximumMessageBytes_) {
            reason = "message larger than 1 MiB";
            return Status::Bad;
        }
        return Status::NeedMore;
    }
    lastMessageBytes_ = partial + (pending - unpacker_.nonparsed_size());
    if (lastMessageBytes_ > maximumMessageBytes_) {
        reason = "message larger than 1 MiB";
        return Status::Bad;
    }
    auto decoded = decodeMsgpack(handle.get(), reason);
    if (!decoded)
        return Status::Bad;
    message = std::move(*decoded);
    return Status::Message;
}

} // namespace mx
