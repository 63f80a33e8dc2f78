#include "EchoServer.h"

#include <cstdlib>
#include <memory>

#include <asio/io_context.hpp>
#include <asio/local/stream_protocol.hpp>
#include <asio/write.hpp>
#include <msgpack.hpp>

#include "wire/MsgpackRpcDecoder.h"
#include "wire/MsgpackRpcMessage.h"

namespace mx::bench {

namespace {

class EchoConnection : public std::enable_shared_from_this<EchoConnection> {
public:
    explicit EchoConnection(asio::local::stream_protocol::socket socket) : socket_(std::move(socket)) {}

    void read()
    {
        auto space = decoder_.buffer();
        socket_.async_read_some(asio::buffer(space.data(), space.size()),
                                [self = shared_from_this()](const std::error_code& error, std::size_t bytes) {
                                    if (error)
                                        return;
                                    self->answer(bytes);
                                });
    }

private:
    void answer(std::size_t bytes)
    {
        decoder_.consumed(bytes);
        auto out = std::make_shared<msgpack::sbuffer>();
        Value message;
        std::string reason;
        while (decoder_.next(message, reason) == MsgpackRpcDecoder::Status::Message) {
            auto request = parseRpcRequest(message, reason);
            if (!request)
                return;
            encodeRpcResponse(*out, request->msgid, Value(), Value());
        }
        asio::async_write(socket_, asio::buffer(out->data(), out->size()),
                          [self = shared_from_this(), out](const std::error_code& error, std::size_t) {
                              if (!error)
                                  self->read();
                          });
    }

    asio::local::stream_protocol::socket socket_;
    MsgpackRpcDecoder decoder_;
};

void accept(asio::local::stream_protocol::acceptor& acceptor)
{
    acceptor.async_accept([&acceptor](const std::error_code& error, asio::local::stream_protocol::socket socket) {
        if (!error)
            std::make_shared<EchoConnection>(std::move(socket))->read();
        accept(acceptor);
    });
}

} // namespace

void runEchoServer(const std::filesystem::path& socketPath)
{
    asio::io_context io;
    std::filesystem::remove(socketPath);
    asio::local::stream_protocol::acceptor acceptor(io, asio::local::stream_protocol::endpoint(socketPath.string()));
    accept(acceptor);
    io.run();
    std::_Exit(0);
}

} // namespace mx::bench
