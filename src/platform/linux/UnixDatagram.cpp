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

std::uint32_t sendUnixDatagram(const std::filesystem::path& path, std::string_view datagram)
{
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string& text = path.native();
    if (text.size() >= sizeof(address.sun_path))
        return ENAMETOOLONG;
    std::copy(text.begin(), text.end(), address.sun_path);
    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return static_cast<std::uint32_t>(errno);
    auto sent = sendto(fd, datagram.data(), datagram.size(), 0, reinterpret_cast<sockaddr*>(&address), sizeof(address));
    std::uint32_t status = sent < 0 ? static_cast<std::uint32_t>(errno) : 0;
    ::close(fd);
    return status;
}

} // namespace mx
