#pragma once
// Device orientation from the sensor proxy (net.hadess.SensorProxy) on the system
// bus, where one runs. The accelerometer is claimed while someone wants device
// orientation and released when nobody does; a proxy that starts later is claimed
// when it appears. Each change of AccelerometerOrientation after a claim's first
// reading is handed on; the reading found at the claim is not, as it is no change.
//
// Everything runs on the thread that runs `io`: construct, call and destroy the
// listener there or before that thread starts. Without a system bus (or with one
// that goes away) the listener logs one line and stays silent.

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <systemd/sd-bus.h>

namespace mx {

class SensorProxyListener {
public:
    // `changed` gets each new orientation as a value of the orientation feed.
    SensorProxyListener(asio::io_context& io, std::function<void(int)> changed);
    ~SensorProxyListener();
    SensorProxyListener(const SensorProxyListener&) = delete;
    SensorProxyListener& operator=(const SensorProxyListener&) = delete;

    // Connects to the system bus (DBUS_SYSTEM_BUS_ADDRESS when set) and watches for
    // the proxy. False when there is no bus to connect to.
    bool connect();
    // Whether the accelerometer should be claimed.
    void setWanted(bool wanted);

private:
    static int onPropertiesChanged(sd_bus_message* message, void* self, sd_bus_error* error);
    static int onOwnerChanged(sd_bus_message* message, void* self, sd_bus_error* error);
    static int onClaimed(sd_bus_message* message, void* self, sd_bus_error* error);
    static int onFirstReading(sd_bus_message* message, void* self, sd_bus_error* error);
    static int onMatchInstalled(sd_bus_message* message, void* self, sd_bus_error* error);

    void claim();
    void release();
    void observe(const std::string& text);
    void pump();
    void waitFor(asio::posix::descriptor_base::wait_type type, bool& waiting);
    void disconnect(int failure);

    std::function<void(int)> changed_;
    sd_bus* bus_ = nullptr;
    asio::posix::stream_descriptor descriptor_;
    asio::steady_timer timer_;
    bool readWaiting_ = false;
    bool writeWaiting_ = false;
    bool wanted_ = false;
    bool claiming_ = false;
    bool claimed_ = false;
    // The last text seen since the claim; nothing until its first reading.
    std::optional<std::string> last_;
};

} // namespace mx
