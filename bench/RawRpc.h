#pragma once
// A msgpack-rpc connection without the client library, for loads that time each
// request themselves: connect, send whole buffers, and read responses as they come.

#include <chrono>
#include <cstddef>
#include <filesystem>
#include <functional>

#include "wire/MsgpackRpcMessage.h"

namespace mx::bench {

// The connected socket, or -1.
int connectRaw(const std::filesystem::path& socket);
// False when the connection took less than all of it.
bool sendAll(int fd, const char* bytes, std::size_t size);
// Hands each response to `handle` with the time its bytes were read, until the
// connection ends (false) or `handle` returns false (true).
bool readResponses(int fd,
                   const std::function<bool(const RpcResponse&, std::chrono::steady_clock::time_point)>& handle);

} // namespace mx::bench
