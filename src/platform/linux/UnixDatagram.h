#pragma once
// The daemon's end of a Unix datagram endpoint: it binds the path (replacing a stale
// socket left by an earlier run, group writable so that the audio group can post;
// UnixSocketBinding). Senders use wire/Datagram.h.

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

} // namespace mx
