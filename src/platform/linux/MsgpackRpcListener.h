#pragma once
// The service endpoint: a Unix stream socket, either the one systemd hands over
// (socket activation) or one bound at a path. Accepts connections on the connection
// layer's one I/O thread and gives each to the delegate to set up.
// Owned by main; lives as long as the process.

#include <filesystem>
#include <list>
#include <memory>
#include <thread>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>

#include "platform/ServiceConnection.h"

namespace mx {

class MsgpackRpcConnection;

class MsgpackRpcListener final : public ServiceListener {
public:
    // Takes the first socket systemd passed, if any; otherwise binds `path`
    // (replacing a stale socket file, creating the directories). Nothing, with
    // `error` set, when neither works.
    static std::unique_ptr<MsgpackRpcListener> make(const std::filesystem::path& path, std::string& error);
    ~MsgpackRpcListener() override;

    void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override;
    void resume() override;

    // Accepts no more connections and reads no further request on any; what is in
    // flight is still answered. Returns once that holds. Any thread but the listener's.
    void stopReading();

    // Where clients connect, for the start-up banner.
    std::string endpointDescription() const { return endpoint_; }
    asio::io_context& ioContext() { return io_; }

private:
    MsgpackRpcListener();
    void acceptNext();

    asio::io_context io_;
    asio::executor_work_guard<asio::io_context::executor_type> keepRunning_;
    asio::local::stream_protocol::acceptor acceptor_;
    asio::steady_timer retry_;
    std::shared_ptr<ServiceListenerDelegate> delegate_;
    std::string endpoint_;
    std::uint64_t accepted_ = 0;
    std::list<std::weak_ptr<MsgpackRpcConnection>> connections_; // listener thread only
    std::thread thread_;
};

} // namespace mx
