#pragma once
// Cuts a byte stream into msgpack-rpc messages and checks each against the limits of
// the connection layer: at most 1 MiB a message, nesting at most 64 deep, string
// map keys only. Used on both ends: the daemon reads requests with it, the client
// library reads responses. Not thread-safe; one per connection.

#include <cstdint>
#include <span>
#include <string>

#include <msgpack.hpp>

#include "platform/Value.h"

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

    // Convenience for tests and fuzzing: feed bytes in one go.
    void feed(const char* bytes, std::size_t count);

private:
    std::size_t maximumMessageBytes_;
    msgpack::unpacker unpacker_;
};

} // namespace mx
