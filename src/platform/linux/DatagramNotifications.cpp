#include "platform/linux/DatagramNotifications.h"

#include <cerrno>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "platform/MxLog.h"

namespace mx {

DatagramNotifications::DatagramNotifications(std::filesystem::path endpoint) : endpoint_(std::move(endpoint)) {}

bool DatagramNotifications::listen(asio::io_context& io, std::string& error)
{
    std::error_code failure;
    std::filesystem::create_directories(endpoint_.parent_path(), failure);
    std::filesystem::remove(endpoint_, failure);
    asio::local::datagram_protocol::endpoint endpoint(endpoint_.string());
    socket_ = std::make_unique<asio::local::datagram_protocol::socket>(io);
    socket_->open(endpoint.protocol(), failure);
    if (!failure)
        socket_->bind(endpoint, failure);
    if (failure) {
        error = "cannot bind " + endpoint_.string() + ": " + failure.message();
        return false;
    }
    chmod(endpoint_.c_str(), 0660);
    receiveNext();
    return true;
}

void DatagramNotifications::receiveNext()
{
    socket_->async_receive(asio::buffer(datagram_), [this](const std::error_code& error, std::size_t bytes) {
        if (error == asio::error::operation_aborted)
            return;
        if (!error)
            deliver(std::string(datagram_.data(), bytes));
        receiveNext();
    });
}

std::uint32_t DatagramNotifications::registerDispatch(const std::string& name, int& token,
                                                      std::shared_ptr<WorkQueue> queue,
                                                      std::function<void(int)> handler)
{
    std::lock_guard lock(mutex_);
    token = nextToken_++;
    registrations_[name].push_back({token, std::move(queue), std::move(handler)});
    return 0;
}

void DatagramNotifications::deliver(const std::string& name)
{
    std::vector<Registration> targets;
    {
        std::lock_guard lock(mutex_);
        auto found = registrations_.find(name);
        if (found != registrations_.end())
            targets = found->second;
    }
    for (auto& registration : targets)
        registration.queue->dispatch([handler = registration.handler, token = registration.token] { handler(token); });
}

std::uint32_t DatagramNotifications::post(const std::string& name)
{
    int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return static_cast<std::uint32_t>(errno);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = endpoint_.string();
    if (path.size() >= sizeof(address.sun_path)) {
        ::close(fd);
        return ENAMETOOLONG;
    }
    std::copy(path.begin(), path.end(), address.sun_path);
    auto sent = sendto(fd, name.data(), name.size(), 0, reinterpret_cast<sockaddr*>(&address), sizeof(address));
    std::uint32_t status = sent < 0 ? static_cast<std::uint32_t>(errno) : 0;
    ::close(fd);
    return status;
}

} // namespace mx
