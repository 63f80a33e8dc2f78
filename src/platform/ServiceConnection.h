#pragma once
// The service connection layer: a named listener accepts client connections; each
// connection carries requests (a method name and its parameters) to the one object
// it exports and carries that object's replies back. The layer knows no method of
// any service. It tells its owner, once, when the connection is interrupted or
// invalidated. All of these calls and handlers run on the connection layer's threads.

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <sys/types.h>

#include "platform/UniqueFunction.h"
#include "value/Value.h"

namespace mx {

class ServiceListener;

// Why a request could not be handed to the service, or was refused whole at one of
// its limits (nothing of it was done). The connection stays usable.
inline constexpr std::int64_t kServiceErrorUnknownMethod = 1;
inline constexpr std::int64_t kServiceErrorBadArguments = 2;
inline constexpr std::int64_t kServiceErrorLimit = 3;

struct ServiceError {
    std::int64_t code = 0;
    std::string message;
    friend bool operator==(const ServiceError&, const ServiceError&) = default;
};

// The way back to the client for one request. Callable from any thread, any number
// of times: the first reply is sent, later ones are dropped, and so is every reply
// whose connection is gone.
class ServiceReply {
public:
    virtual ~ServiceReply() = default;
    virtual void respond(const Value& result) = 0;
    virtual void fail(const ServiceError& error) = 0;
    // The request's work is done and its reply is held for later (a start reply kept
    // until the session stops): it no longer counts among the connection's requests
    // waiting for work.
    virtual void hold() = 0;
};

// What a connection exports: it is handed every request of the connection, in the
// order they arrived, on the connection layer's thread.
class ServiceExportedObject {
public:
    virtual ~ServiceExportedObject() = default;
    // `params` is nothing when the request's parameters are not an array.
    virtual void handleRequest(const std::string& method, const Array* params, std::shared_ptr<ServiceReply> reply) = 0;
    // Whether the client owes the service so much (what its requests left to be written)
    // that no further request of its should be read yet. Any thread; cheap.
    virtual bool overdrawn() const = 0;
    // Runs `resume` once the client may be read again: on the thread that settles
    // enough of its debt, or here, at once, when it may already.
    virtual void whenSettled(UniqueFunction<void()> resume) = 0;
};

class ServiceConnection {
public:
    virtual ~ServiceConnection() = default;
    virtual pid_t processIdentifier() const = 0;
    virtual std::string description() const = 0;
    // Requests arriving on the connection are handed to `object`, which the
    // connection holds until it is invalidated.
    virtual void setExportedObject(std::shared_ptr<ServiceExportedObject> object) = 0;
    virtual void setInterruptionHandler(std::function<void()> handler) = 0;
    virtual void setInvalidationHandler(std::function<void()> handler) = 0;
    // Starts delivering requests.
    virtual void resume() = 0;
};

class ServiceListenerDelegate {
public:
    virtual ~ServiceListenerDelegate() = default;
    // Sets the connection up and answers whether to keep it.
    virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                           std::shared_ptr<ServiceConnection> connection) = 0;
};

class ServiceListener {
public:
    virtual ~ServiceListener() = default;
    virtual void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) = 0;
    // Starts accepting connections.
    virtual void resume() = 0;
};

} // namespace mx
