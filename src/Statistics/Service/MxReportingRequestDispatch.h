#pragma once
// What a client connection exports: binds each method name of the wire to its
// operation of the request protocol, reading the operation's arguments from the
// request's parameters. A request that cannot be handed on (unknown method, wrong
// number or types of arguments) is answered with a service error at once.
// Owned by its connection; runs on the connection layer's thread.

#include <memory>
#include <string>

#include "platform/ServiceConnection.h"

namespace mx {

class MxReportingServiceProtocol;

class MxReportingRequestDispatch final : public ServiceExportedObject {
public:
    explicit MxReportingRequestDispatch(std::shared_ptr<MxReportingServiceProtocol> service);

    void handleRequest(const std::string& method, const Array* params, std::shared_ptr<ServiceReply> reply) override;

private:
    const std::shared_ptr<MxReportingServiceProtocol> service_;
};

} // namespace mx
