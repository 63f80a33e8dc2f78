#include "platform/linux/MsgpackRpcListener.h"

#include <future>
#include <utility>
#include <vector>

#include <asio/post.hpp>
#include <sys/stat.h>

#include <systemd/sd-daemon.h>

#include "platform/MxLog.h"
#include "platform/linux/MsgpackRpcConnection.h"
#include "platform/linux/UnixSocketBinding.h"

namespace mx {

MsgpackRpcListener::MsgpackRpcListener(asio::io_context& io)
    : io_(io), strand_(asio::make_strand(io)), acceptor_(strand_), retry_(strand_)
{
}

std::unique_ptr<MsgpackRpcListener> MsgpackRpcListener::make(const std::filesystem::path& path, asio::io_context& io,
                                                             std::string& error)
{
    std::unique_ptr<MsgpackRpcListener> listener(new MsgpackRpcListener(io));
    std::error_code failure;
    if (sd_listen_fds(1) >= 1 && sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) > 0) {
        listener->acceptor_.assign(asio::local::stream_protocol(), SD_LISTEN_FDS_START, failure);
        if (failure) {
            error = "cannot take the socket systemd passed: " + failure.message();
            return nullptr;
        }
        listener->endpoint_ = "socket passed by systemd";
        return listener;
    }

    auto& acceptor = listener->acceptor_;
    acceptor.open(asio::local::stream_protocol(), failure);
    // Audio clients run as other users of the audio group.
    if (!failure && !bindUnixSocketPath(acceptor.native_handle(), path, kSocketMode, error))
        return nullptr;
    if (!failure)
        acceptor.listen(asio::socket_base::max_listen_connections, failure);
    if (failure) {
        error = "cannot listen on " + path.string() + ": " + failure.message();
        return nullptr;
    }
    listener->endpoint_ = path.string();
    return listener;
}

void MsgpackRpcListener::setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate)
{
    delegate_ = std::move(delegate);
}

void MsgpackRpcListener::resume()
{
    asio::post(strand_, [this] {
        if (!std::exchange(accepting_, true))
            acceptNext();
    });
}

void MsgpackRpcListener::stopReading()
{
    std::promise<std::vector<std::shared_ptr<MsgpackRpcConnection>>> accepted;
    asio::post(strand_, [&] {
        std::error_code ignored;
        acceptor_.close(ignored);
        retry_.cancel();
        std::vector<std::shared_ptr<MsgpackRpcConnection>> live;
        for (const auto& known : connections_)
            if (auto connection = known.lock())
                live.push_back(std::move(connection));
        accepted.set_value(std::move(live));
    });
    // Each on its own strand, from here: the listener's strand must not wait on another.
    for (const auto& connection : accepted.get_future().get())
        connection->stopReading();
}

void MsgpackRpcListener::acceptNext()
{
    // Each connection's socket runs its handlers on a strand of its own.
    acceptor_.async_accept(
        asio::make_strand(io_), [this](const std::error_code& error, asio::local::stream_protocol::socket socket) {
            if (error) {
                if (error == asio::error::operation_aborted)
                    return;
                // Out of descriptors and the like: say so, and try again shortly rather
                // than spin on a failing accept.
                MXLOG_LIMITED(nullptr, Error, "accept failed: {}", error.message());
                retry_.expires_after(std::chrono::milliseconds(100));
                retry_.async_wait([this](const std::error_code& cancelled) {
                    if (!cancelled)
                        acceptNext();
                });
                return;
            } else {
                auto connection = std::make_shared<MsgpackRpcConnection>(std::move(socket), ++accepted_);
                if (!delegate_ || !delegate_->shouldAcceptNewConnection(*this, connection))
                    connection.reset();
                std::erase_if(connections_, [](const auto& known) { return known.expired(); });
                if (connection)
                    connections_.push_back(connection);
            }
            acceptNext();
        });
}

} // namespace mx
