#include "platform/linux/SensorProxyListener.h"

#include <cstring>
#include <poll.h>
#include <system_error>

#include "platform/MxLog.h"

namespace mx {

namespace {

constexpr const char* kProxy = "net.hadess.SensorProxy";
constexpr const char* kProxyPath = "/net/hadess/SensorProxy";
constexpr const char* kProperty = "AccelerometerOrientation";

std::string errorText(int failure) { return std::generic_category().message(-failure); }

std::string errorText(const sd_bus_error* error)
{
    return std::string(error && error->name ? error->name : "unknown error") + ": " +
        (error && error->message ? error->message : "");
}

// The feed's value of a proxy orientation text ("left-up" is 3, landscape-left).
int orientationOfProxyText(std::string_view text)
{
    if (text == "normal")
        return 1;
    if (text == "bottom-up")
        return 2;
    if (text == "left-up")
        return 3;
    if (text == "right-up")
        return 4;
    return 0;
}

} // namespace

SensorProxyListener::SensorProxyListener(asio::io_context& io, std::function<void(int)> changed)
    : changed_(std::move(changed)), descriptor_(io), timer_(io)
{
}

SensorProxyListener::~SensorProxyListener()
{
    if (descriptor_.is_open())
        descriptor_.release();
    if (bus_)
        sd_bus_flush_close_unref(bus_);
}

bool SensorProxyListener::connect()
{
    if (int failure = sd_bus_open_system(&bus_); failure < 0) {
        bus_ = nullptr;
        MXLOG_LIMITED(nullptr, Info, "orientation: no system bus ({}); device orientation comes from the feed alone",
                      errorText(failure));
        return false;
    }
    std::string changes = std::string("type='signal',sender='") + kProxy + "',path='" + kProxyPath +
        "',interface='org.freedesktop.DBus.Properties',member='PropertiesChanged'";
    std::string owners =
        std::string("type='signal',sender='org.freedesktop.DBus',member='NameOwnerChanged',arg0='") + kProxy + "'";
    sd_bus_add_match_async(bus_, nullptr, changes.c_str(), onPropertiesChanged, onMatchInstalled, this);
    sd_bus_add_match_async(bus_, nullptr, owners.c_str(), onOwnerChanged, onMatchInstalled, this);
    descriptor_.assign(sd_bus_get_fd(bus_));
    pump();
    return true;
}

void SensorProxyListener::setWanted(bool wanted)
{
    wanted_ = wanted;
    if (wanted_)
        claim();
    else
        release();
    pump();
}

void SensorProxyListener::claim()
{
    if (!bus_ || claiming_ || claimed_)
        return;
    claiming_ = true;
    sd_bus_call_method_async(bus_, nullptr, kProxy, kProxyPath, kProxy, "ClaimAccelerometer", onClaimed, this, "");
}

void SensorProxyListener::release()
{
    if (!bus_ || !claimed_)
        return;
    claimed_ = false;
    last_.reset();
    sd_bus_call_method_async(bus_, nullptr, kProxy, kProxyPath, kProxy, "ReleaseAccelerometer", nullptr, nullptr, "");
}

int SensorProxyListener::onClaimed(sd_bus_message* message, void* self, sd_bus_error*)
{
    auto& listener = *static_cast<SensorProxyListener*>(self);
    listener.claiming_ = false;
    if (sd_bus_message_is_method_error(message, nullptr)) {
        // The usual case on a machine without the proxy: its appearance claims again.
        MXLOG_LIMITED(nullptr, Info, "orientation: the sensor proxy cannot be claimed ({})",
                      errorText(sd_bus_message_get_error(message)));
        return 0;
    }
    listener.claimed_ = true;
    if (!listener.wanted_) {
        listener.release();
        return 0;
    }
    sd_bus_call_method_async(listener.bus_, nullptr, kProxy, kProxyPath, "org.freedesktop.DBus.Properties", "Get",
                             onFirstReading, self, "ss", kProxy, kProperty);
    return 0;
}

int SensorProxyListener::onFirstReading(sd_bus_message* message, void* self, sd_bus_error*)
{
    const char* text = nullptr;
    if (sd_bus_message_is_method_error(message, nullptr) || sd_bus_message_read(message, "v", "s", &text) <= 0)
        return 0;
    static_cast<SensorProxyListener*>(self)->observe(text);
    MXLOG_LIMITED(nullptr, Info, "orientation: device orientation from the sensor proxy, {} now", text);
    return 0;
}

int SensorProxyListener::onPropertiesChanged(sd_bus_message* message, void* self, sd_bus_error*)
{
    const char* interface = nullptr;
    if (sd_bus_message_read(message, "s", &interface) <= 0 || std::strcmp(interface, kProxy) != 0)
        return 0;
    if (sd_bus_message_enter_container(message, SD_BUS_TYPE_ARRAY, "{sv}") <= 0)
        return 0;
    while (sd_bus_message_enter_container(message, SD_BUS_TYPE_DICT_ENTRY, "sv") > 0) {
        const char* name = nullptr;
        const char* text = nullptr;
        if (sd_bus_message_read(message, "s", &name) <= 0)
            return 0;
        if (std::strcmp(name, kProperty) == 0) {
            if (sd_bus_message_read(message, "v", "s", &text) <= 0)
                return 0;
            static_cast<SensorProxyListener*>(self)->observe(text);
        } else if (sd_bus_message_skip(message, "v") < 0) {
            return 0;
        }
        sd_bus_message_exit_container(message);
    }
    return 0;
}

int SensorProxyListener::onOwnerChanged(sd_bus_message* message, void* self, sd_bus_error*)
{
    const char* name = nullptr;
    const char* before = nullptr;
    const char* after = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &before, &after) <= 0)
        return 0;
    auto& listener = *static_cast<SensorProxyListener*>(self);
    // A proxy that left took its claim with it; one that arrived is claimed if wanted.
    listener.claimed_ = false;
    listener.last_.reset();
    if (*after != '\0' && listener.wanted_)
        listener.claim();
    return 0;
}

int SensorProxyListener::onMatchInstalled(sd_bus_message* message, void*, sd_bus_error*)
{
    if (sd_bus_message_is_method_error(message, nullptr))
        MXLOG_LIMITED(nullptr, Error, "orientation: cannot watch the sensor proxy ({})",
                      errorText(sd_bus_message_get_error(message)));
    return 0;
}

void SensorProxyListener::observe(const std::string& text)
{
    if (!claimed_)
        return;
    if (!last_) {
        if (text != "undefined")
            last_ = text;
        return;
    }
    if (text == *last_)
        return;
    last_ = text;
    changed_(orientationOfProxyText(text));
}

void SensorProxyListener::pump()
{
    if (!bus_)
        return;
    for (;;) {
        int progress = sd_bus_process(bus_, nullptr);
        if (progress < 0) {
            disconnect(progress);
            return;
        }
        if (progress == 0)
            break;
    }
    int events = sd_bus_get_events(bus_);
    if (events < 0) {
        disconnect(events);
        return;
    }
    waitFor(asio::posix::descriptor_base::wait_read, readWaiting_);
    if (events & POLLOUT)
        waitFor(asio::posix::descriptor_base::wait_write, writeWaiting_);
    std::uint64_t deadline = 0;
    if (sd_bus_get_timeout(bus_, &deadline) >= 0 && deadline != UINT64_MAX) {
        // Both count microseconds of CLOCK_MONOTONIC.
        timer_.expires_at(std::chrono::steady_clock::time_point(std::chrono::microseconds(deadline)));
        timer_.async_wait([this](const std::error_code& cancelled) {
            if (!cancelled)
                pump();
        });
    }
}

void SensorProxyListener::waitFor(asio::posix::descriptor_base::wait_type type, bool& waiting)
{
    if (waiting)
        return;
    waiting = true;
    descriptor_.async_wait(type, [this, &waiting](const std::error_code& cancelled) {
        waiting = false;
        if (!cancelled)
            pump();
    });
}

void SensorProxyListener::disconnect(int failure)
{
    MXLOG_LIMITED(nullptr, Error,
                  "orientation: the system bus connection ended ({}); device orientation comes from the "
                  "feed alone",
                  errorText(failure));
    timer_.cancel();
    descriptor_.release();
    sd_bus_flush_close_unref(bus_);
    bus_ = nullptr;
    claimed_ = false;
    claiming_ = false;
}

} // namespace mx
