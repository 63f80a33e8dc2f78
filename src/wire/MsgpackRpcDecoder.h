#pragma once
// Cuts a byte stream into msgpack-rpc messages and checks each against the limits of
// the connection layer: at most 1 MiB a message, nesting at most 64 deep, string
// map keys only. Declared sizes are checked as their headers arrive, before anything
// is reserved for them. Used on both ends: the daemon reads requests with it, the client
// library reads responses. Not thread-safe; one per connection.

#include <cstdint>
#include <span>
#include <string>

#include <msgpack.hpp>

#include "value/Value.h"
#include "wire/MsgpackSizeGuard.h"

namespace mx {

inline constexpr std::size_t kMsgpackRpcMaximumMessageBytes = 1 << 20;

class MsgpackRpcDecoder {
public:
    enum class Status { Message, NeedMore, Bad };

    explicit MsgpackRpcDecoder(std::size_t maximumMessageBytes = kMsgpackRpcMaximumMessageBytes);

    // Where the next bytes read from the stream go; at least `atLeast` bytes long.
    std::span<char> buffer(std::size_t atLeast = std::size_t{16} * 1024);
    void consumed(std::size_t count);

    // The next complete message, or NeedMore, or Bad with `reason` set. After Bad
    // the stream cannot be trusted and must be closed.
    Status next(Value& message, std::string& reason);

    // The wire size of the message `next` returned last.
    std::size_t lastMessageBytes() const { return lastMessageBytes_; }
    // After `next` said NeedMore: the bytes of a message that has begun to arrive.
    std::size_t partialBytes() const { return unpacker_.parsed_size() + unpacker_.nonparsed_size(); }

    // Convenience for tests and fuzzing: feed bytes in one go.
    void feed(const char* bytes, std::size_t count);

private:
    std::size_t maximumMessageBytes_;
    msgpack::unpacker unpacker_;
    MsgpackSizeGuard guard_;
    std::string guardReason_;
    std::size_t lastMessageBytes_ = 0;
};

} // namespace mx
