#include "platform/linux/UnixDatagram.h"

#include "platform/linux/UnixSocketBinding.h"

#include <algorithm>
#include <cerrno>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace mx {

std::unique_ptr<asio::local::datagram_protocol::socket> bindUnixDatagram(asio::io_context& io,
                                                                         const std::filesystem::path& path,
                                                                         std::string& error)
{
    std::error_code failure;
    auto socket = std::make_unique<asio::local::datagram_protocol::socket>(io);
    socket->open(asio::local::datagram_protocol(), failure);
    if (failure) {
        error = "cannot bind " + path.string() + ": " + failure.message();
        return nullptr;
    }
    if (!bindUnixSocketPath(socket->native_handle(), path, kSocketMode, error))
        return nullptr;
    return socket;
}

} // namespace mx
