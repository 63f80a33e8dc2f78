#include "wire/Datagram.h"

#include <algorithm>
#include <cerrno>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "wire/RootPath.h"

namespace mx {

std::uint32_t sendDatagram(const std::filesystem::path& endpoint, std::string_view datagram)
{
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string& text = endpoint.native();
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

std::uint32_t postNotification(std::string_view name)
{
    return sendDatagram(MxReportingPath(kNotificationSocketPath), name);
}

} // namespace mx
