// libFuzzer target: arbitrary bytes from a client through a real connection over a
// socket pair: the decoder and its size guard, the request dispatch, the replies and
// their back-pressure (the client reads its replies only when the input says so).
// Nothing may crash, hang or leak, and a connection that the client leaves must close.

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <asio/io_context.hpp>

#include "AnsweringService.h"
#include "Statistics/Service/MxReportingRequestDispatch.h"
#include "platform/MxLog.h"
#include "platform/linux/MsgpackRpcConnection.h"

namespace {

using namespace mx;

class SilentLog final : public MxLogSink {
public:
    void write(const MxLogRecord&) override {}
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size)
{
    static SilentLog log;
    static ScopedInstall<MxLogSink> installLog(log);
    if (size < 2)
        return 0;
    // The first byte picks the write size, the second whether the client reads replies.
    std::size_t chunk = 1 + data[0] * 16u;
    bool reads = (data[1] & 1) != 0;
    data += 2;
    size -= 2;

    int ends[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, ends) != 0)
        return 0;
    asio::io_context io;
    asio::local::stream_protocol::socket socket(io);
    socket.assign(asio::local::stream_protocol(), ends[0]);
    bool invalidated = false;
    {
        auto connection = std::make_shared<MsgpackRpcConnection>(std::move(socket), 1);
        connection->setExportedObject(std::make_shared<MxReportingRequestDispatch>(
            std::make_shared<AnsweringService>(true), answerStatus, nullptr));
        connection->setInvalidationHandler([&] { invalidated = true; });
        connection->resume();
    }
    char replies[65536];
    std::size_t offset = 0;
    for (int idle = 0; idle < 4;) {
        bool progress = io.poll() > 0;
        if (offset < size) {
            ssize_t sent = ::send(ends[1], data + offset, std::min(chunk, size - offset), MSG_NOSIGNAL);
            if (sent > 0) {
                offset += std::size_t(sent);
                progress = true;
            }
        }
        if (reads && ::recv(ends[1], replies, sizeof(replies), 0) > 0)
            progress = true;
        idle = progress ? 0 : idle + 1;
        if (invalidated)
            break;
    }
    // The client leaves, reading what is left: the connection must notice and close,
    // also one paused at a bound, which looks for its client twice a second.
    ::shutdown(ends[1], SHUT_WR);
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(2);
    while (!invalidated && std::chrono::steady_clock::now() < deadline) {
        io.run_for(std::chrono::milliseconds(5));
        while (::recv(ends[1], replies, sizeof(replies), 0) > 0) {}
    }
    ::close(ends[1]);
    if (!invalidated)
        __builtin_trap(); // a connection that outlives its client
    return 0;
}
