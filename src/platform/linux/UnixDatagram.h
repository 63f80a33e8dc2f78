#pragma once
// The two ends of a Unix datagram endpoint, as the daemon's feeds use them: the
// daemon binds the path (replacing a stale socket left by an earlier run, group
// writable so that the audio group can post; UnixSocketBinding), anyone else sends
// one datagram to it.

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>

#include <asio/io_context.hpp>
#include <asio/local/datagram_protocol.hpp>

namespace mx {

// The bound socket, or nothing with `error`.
std::unique_ptr<asio::local::datagram_protocol::socket> bindUnixDatagram(asio::io_context& io,
                                                                         const std::filesystem::path& path,
                                                                         std::string& error);
// 0, or the errno of the failure (ECONNREFUSED or ENOENT: nobody is bound there).
std::uint32_t sendUnixDatagram(const std::filesystem::path& path, std::string_view datagram);

} // namespace mx
