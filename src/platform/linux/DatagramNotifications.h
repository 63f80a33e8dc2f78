#pragma once
// Named notifications over a Unix datagram socket: a post is the name sent as one
// datagram to the notification endpoint; the daemon, bound there, tells every
// registration for that name on the queue it chose. Posts that arrive while one is
// still waiting on that queue are folded into it: a notification says "look again",
// and one look after the last post sees all of them. The daemon posts to itself
// without the socket (deliver), which is how SIGHUP re-reads the preferences.

#include <array>
#include <atomic>
#include <filesystem>
#include <map>
#include <mutex>
#include <vector>

#include <asio/io_context.hpp>
#include <asio/local/datagram_protocol.hpp>

#include "platform/Notifications.h"

namespace mx {

class DatagramNotifications final : public Notifications {
public:
    explicit DatagramNotifications(std::filesystem::path endpoint);

    // Binds the endpoint and receives on `io` (the daemon side). False, with
    // `error`, when the endpoint cannot be bound.
    bool listen(asio::io_context& io, std::string& error);

    std::uint32_t registerDispatch(const std::string& name, int& token, std::shared_ptr<WorkQueue> queue,
                                   std::function<void(int token)> handler) override;
    std::uint32_t post(const std::string& name) override;
    // Tells the registrations in this process, as a received post would.
    void deliver(const std::string& name);

private:
    struct Registration {
        int token;
        std::shared_ptr<WorkQueue> queue;
        std::function<void(int)> handler;
        // Set from a post until its handler starts.
        std::shared_ptr<std::atomic<bool>> waiting = std::make_shared<std::atomic<bool>>(false);
    };

    void receiveNext();

    std::filesystem::path endpoint_;
    std::mutex mutex_;
    std::map<std::string, std::vector<Registration>> registrations_;
    int nextToken_ = 1;
    std::unique_ptr<asio::local::datagram_protocol::socket> socket_;
    std::array<char, 256> datagram_{};
};

} // namespace mx
