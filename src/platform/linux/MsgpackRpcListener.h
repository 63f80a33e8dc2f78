#pragma once
// The service endpoint: a Unix stream socket, either the one systemd hands over
// (socket activation) or one bound at a path. Accepts connections on a given I/O
// context and gives each to the delegate to set up. The daemon gives it the context
// of the server queue's pool, so that reading a request, handling it and writing its
// reply happen on one thread; each connection and the acceptor run on strands of
// their own, so a thread the pool lends while its worker blocks never runs two
// handlers of one connection at once.
// Owned by main; lives as long as the process.

#include <filesystem>
#include <list>
#include <memory>

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>
#include <asio/strand.hpp>

#include "platform/ServiceConnection.h"

namespace mx {

class MsgpackRpcConnection;

class MsgpackRpcListener final : public ServiceListener {
public:
    // Takes the first socket systemd passed, if any; otherwise binds `path`
    // (replacing a stale socket file, creating the directories). Nothing, with
    // `error` set, when neither works.
    static std::unique_ptr<MsgpackRpcListener> make(const std::filesystem::path& path, asio::io_context& io,
                                                    std::string& error);

    void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override;
    void resume() override;

    // Accepts no more connections and reads no further request on any; what is in
    // flight is still answered. Returns once that holds. Any thread outside `io`'s.
    void stopReading();

    // Where clients connect, for the start-up banner.
    std::string endpointDescription() const { return endpoint_; }

private:
    explicit MsgpackRpcListener(asio::io_context& io);
    void acceptNext();

    asio::io_context& io_;
    asio::strand<asio::io_context::executor_type> strand_; // the acceptor's and the connection list's
    asio::local::stream_protocol::acceptor acceptor_;
    asio::steady_timer retry_;
    std::shared_ptr<ServiceListenerDelegate> delegate_;
    std::string endpoint_;
    std::uint64_t accepted_ = 0;
    std::list<std::weak_ptr<MsgpackRpcConnection>> connections_; // strand_ only
    bool accepting_ = false;
};

} // namespace mx
