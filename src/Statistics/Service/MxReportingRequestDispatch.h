#pragma once
// What a client connection exports: binds each method name of the wire to its
// operation of the request protocol, reading the operation's arguments from the
// request's parameters. A request that cannot be handed on (unknown method, wrong
// number or types of arguments) is answered with a service error at once, and so is
// one past a limit that can be seen in the request itself (too many reporter IDs).
// The one method outside the protocol, "status", is answered by the service root.
// Owned by its connection; runs on the connection layer's thread.

#include <functional>
#include <memory>
#include <string>

#include "platform/BacklogAccount.h"
#include "platform/ServiceConnection.h"

namespace mx {

class MxReportingServiceProtocol;

class MxReportingRequestDispatch final : public ServiceExportedObject {
public:
    // Asks for the status view; the callback gets it on whatever thread built it.
    using StatusRequest = std::function<void(std::function<void(Dictionary)>)>;

    // `backlog`: what the client owes the stores and backends; nothing, and it never
    // owes anything.
    MxReportingRequestDispatch(std::shared_ptr<MxReportingServiceProtocol> service, StatusRequest status,
                               std::shared_ptr<BacklogAccount> backlog);

    void handleRequest(const std::string& method, const Array* params, std::shared_ptr<ServiceReply> reply) override;
    bool overdrawn() const override;
    void whenSettled(UniqueFunction<void()> resume) override;

private:
    const std::shared_ptr<MxReportingServiceProtocol> service_;
    const StatusRequest status_;
    const std::shared_ptr<BacklogAccount> backlog_;
};

} // namespace mx
