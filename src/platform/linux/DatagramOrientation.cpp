#include "platform/linux/DatagramOrientation.h"

#include <asio/post.hpp>

#include "platform/MxLog.h"
#include "platform/linux/SensorProxyListener.h"
#include "platform/linux/UnixDatagram.h"
#include "value/ValueText.h"

namespace mx {

DatagramOrientation::DatagramOrientation(std::filesystem::path feed)
    : feed_(std::move(feed)), keepRunning_(io_.get_executor())
{
}

DatagramOrientation::~DatagramOrientation()
{
    keepRunning_.reset();
    io_.stop();
    if (thread_.joinable())
        thread_.join();
}

bool DatagramOrientation::listen(std::string& error)
{
    socket_ = bindUnixDatagram(io_, feed_, error);
    if (!socket_)
        return false;
    receiveNext();
    sensorProxy_ = std::make_unique<SensorProxyListener>(
        io_, [this](int orientation) { deliver(OrientationKind::Device, orientation); });
    if (!sensorProxy_->connect())
        sensorProxy_.reset();
    thread_ = std::thread([this] { io_.run(); });
    return true;
}

void DatagramOrientation::receiveNext()
{
    socket_->async_receive(asio::buffer(datagram_), [this](const std::error_code& error, std::size_t bytes) {
        if (error == asio::error::operation_aborted)
            return;
        std::string_view text(datagram_.data(), error ? 0 : bytes);
        if (auto change = parseOrientationDatagram(text)) {
            deliver(change->kind, change->orientation);
        } else if (!error) {
            std::string quoted;
            appendQuotedText(quoted, text.substr(0, 64));
            MXLOG_LIMITED(nullptr, Error, "orientation feed: ignored {}: a change is \"device N\" or \"ui N\"", quoted);
        }
        receiveNext();
    });
}

void DatagramOrientation::deliver(OrientationKind kind, int orientation)
{
    std::lock_guard delivering(deliveryMutex_);
    std::vector<std::function<void(int)>> callbacks;
    {
        std::lock_guard lock(registryMutex_);
        for (const auto& [identifier, callback] : registrationsOf(kind))
            callbacks.push_back(callback);
    }
    for (const auto& callback : callbacks)
        callback(orientation);
}

void DatagramOrientation::registerDeviceOrientation(const std::string& identifier, std::function<void(int)> callback)
{
    registerFor(OrientationKind::Device, identifier, std::move(callback));
}

void DatagramOrientation::registerUIOrientation(const std::string& identifier, std::function<void(int)> callback)
{
    registerFor(OrientationKind::UI, identifier, std::move(callback));
}

void DatagramOrientation::unregisterDeviceOrientation(const std::string& identifier)
{
    unregisterFor(OrientationKind::Device, identifier);
}

void DatagramOrientation::unregisterUIOrientation(const std::string& identifier)
{
    unregisterFor(OrientationKind::UI, identifier);
}

std::string DatagramOrientation::orientationName(int orientation) { return std::string(orientationText(orientation)); }

void DatagramOrientation::registerFor(OrientationKind kind, const std::string& identifier,
                                      std::function<void(int)> callback)
{
    std::lock_guard lock(registryMutex_);
    auto& registrations = registrationsOf(kind);
    registrations[identifier] = std::move(callback);
    // Posted under the lock, so that the proxy sees the claims and releases in order.
    if (kind == OrientationKind::Device && registrations.size() == 1 && sensorProxy_)
        asio::post(io_, [this] { sensorProxy_->setWanted(true); });
}

void DatagramOrientation::unregisterFor(OrientationKind kind, const std::string& identifier)
{
    {
        std::lock_guard lock(registryMutex_);
        auto& registrations = registrationsOf(kind);
        if (registrations.erase(identifier) == 0)
            return;
        if (kind == OrientationKind::Device && registrations.empty() && sensorProxy_)
            asio::post(io_, [this] { sensorProxy_->setWanted(false); });
    }
    // A round that copied the callback before the erase is over once this is taken.
    std::lock_guard waitForRound(deliveryMutex_);
}

DatagramOrientation::Registrations& DatagramOrientation::registrationsOf(OrientationKind kind)
{
    return kind == OrientationKind::Device ? device_ : ui_;
}

} // namespace mx
