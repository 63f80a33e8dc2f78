#include "platform/linux/DatagramNotifications.h"

#include "platform/linux/UnixDatagram.h"
#include "wire/Datagram.h"

namespace mx {

DatagramNotifications::DatagramNotifications(std::filesystem::path endpoint) : endpoint_(std::move(endpoint)) {}

bool DatagramNotifications::listen(asio::io_context& io, std::string& error)
{
    socket_ = bindUnixDatagram(io, endpoint_, error);
    if (!socket_)
        return false;
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
    for (auto& registration : targets) {
        if (registration.waiting->exchange(true))
            continue;
        // Cleared before the handler runs: a post during it is looked at again.
        registration.queue->dispatch(
            [handler = registration.handler, token = registration.token, waiting = registration.waiting] {
                waiting->store(false);
                handler(token);
            });
    }
}

std::uint32_t DatagramNotifications::post(const std::string& name) { return sendDatagram(endpoint_, name); }

} // namespace mx
