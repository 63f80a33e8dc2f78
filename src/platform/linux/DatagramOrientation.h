#pragma once
// The orientation service on Linux. Changes arrive as datagrams on the orientation
// feed ("device N", "ui N") and, for the device, from the sensor proxy on the system
// bus where one runs; each is handed to every callback registered for its kind, on
// the service's own thread, one change after another.

#include <array>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/local/datagram_protocol.hpp>

#include "platform/Orientation.h"
#include "wire/OrientationDatagram.h"

namespace mx {

class SensorProxyListener;

class DatagramOrientation final : public Orientation {
public:
    explicit DatagramOrientation(std::filesystem::path feed);
    ~DatagramOrientation() override;
    DatagramOrientation(const DatagramOrientation&) = delete;
    DatagramOrientation& operator=(const DatagramOrientation&) = delete;

    // Binds the feed, looks for the sensor proxy and starts the service's thread.
    // False, with `error`, when the feed cannot be bound.
    bool listen(std::string& error);

    void registerDeviceOrientation(const std::string& identifier, std::function<void(int)> callback) override;
    void registerUIOrientation(const std::string& identifier, std::function<void(int)> callback) override;
    void unregisterDeviceOrientation(const std::string& identifier) override;
    void unregisterUIOrientation(const std::string& identifier) override;
    std::string orientationName(int orientation) override;

private:
    using Registrations = std::map<std::string, std::function<void(int)>>;

    void receiveNext();
    void deliver(OrientationKind kind, int orientation);
    void registerFor(OrientationKind kind, const std::string& identifier, std::function<void(int)> callback);
    void unregisterFor(OrientationKind kind, const std::string& identifier);
    Registrations& registrationsOf(OrientationKind kind);

    std::filesystem::path feed_;
    asio::io_context io_;
    asio::executor_work_guard<asio::io_context::executor_type> keepRunning_;
    std::unique_ptr<asio::local::datagram_protocol::socket> socket_;
    std::array<char, 256> datagram_{};
    std::unique_ptr<SensorProxyListener> sensorProxy_;

    std::mutex registryMutex_;
    Registrations device_;
    Registrations ui_;
    // Held through each change's round of callbacks: an unregistration waits on it, so
    // that no callback it ended is still running, or about to, when it returns.
    std::recursive_mutex deliveryMutex_;
    std::thread thread_;
};

} // namespace mx
