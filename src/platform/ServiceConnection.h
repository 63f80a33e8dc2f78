#pragma once
// The service connection layer: a named listener accepts client connections; each
// connection exports one object implementing the request protocol and tells its
// owner, once, when it is interrupted or invalidated. All of these calls and
// handlers run on the connection layer's threads.

#include <functional>
#include <memory>
#include <string>
#include <sys/types.h>

namespace mx {

class MxReportingServiceProtocol;
class ServiceListener;

class ServiceConnection {
public:
    virtual ~ServiceConnection() = default;
    virtual pid_t processIdentifier() const = 0;
    virtual std::string description() const = 0;
    // Requests arriving on the connection are handed to `object`, which the
    // connection holds until it is invalidated.
    virtual void setExportedObject(std::shared_ptr<MxReportingServiceProtocol> object) = 0;
    virtual void setInterruptionHandler(std::function<void()> handler) = 0;
    virtual void setInvalidationHandler(std::function<void()> handler) = 0;
    // Starts delivering requests.
    virtual void resume() = 0;
};

class ServiceListenerDelegate {
public:
    virtual ~ServiceListenerDelegate() = default;
    // Sets the connection up and answers whether to keep it.
    virtual bool shouldAcceptNewConnection(ServiceListener& listener, std::shared_ptr<ServiceConnection> connection) = 0;
};

class ServiceListener {
public:
    virtual ~ServiceListener() = default;
    virtual void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) = 0;
    // Starts accepting connections.
    virtual void resume() = 0;
};

} // namespace mx
