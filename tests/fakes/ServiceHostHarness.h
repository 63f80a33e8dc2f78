#pragma once
// The real service root over fakes of everything it is handed, with connections
// accepted through it: the tests of the root and of its endpoints share it. The queue
// it runs on is driven by `run`, a FakeDispatch's runUntilIdle or a wait on real
// threads.

#include <functional>
#include <memory>
#include <stdexcept>
#include <vector>

#include "Statistics/Service/MxReportingServiceDelegate.h"
#include "fakes/FakeChanstat.h"
#include "fakes/FakeServiceHost.h"

namespace mx::testing {

class ServiceHostHarness {
public:
    explicit ServiceHostHarness(std::function<void()> run) : run_(std::move(run)) {}

    // Makes the root: after the test has set up the driver channels it subscribes to.
    void start() { root = MxReportingServiceDelegate::make(preferences, notifications, processes, chanstat); }

    std::shared_ptr<FakeServiceConnection> accept(pid_t pid)
    {
        auto connection = std::make_shared<FakeServiceConnection>(pid);
        if (!root->shouldAcceptNewConnection(listener_, connection) || !connection->resumed)
            throw std::logic_error("connection refused");
        connections.push_back(connection);
        return connection;
    }

    // The endpoints in connection order, read on the server queue they belong to.
    std::vector<std::shared_ptr<MxReportingServerInstance>> clients()
    {
        std::vector<std::shared_ptr<MxReportingServerInstance>> clients;
        root->serverQueue()->dispatch([&] { clients = root->getAllClients(); });
        run_();
        return clients;
    }

    // The endpoint of a newly accepted connection of `pid`.
    std::shared_ptr<MxReportingServerInstance> connect(pid_t pid)
    {
        accept(pid);
        return clients().back();
    }

    // Sets the preferences and posts their notification, as an administrator would.
    void setPreferences(Dictionary stored)
    {
        preferences.domains["com.kestrel.harmonia"] = std::move(stored);
        notifications.post("com.kestrel.harmonia.reporting");
        run_();
    }

    FakePreferences preferences;
    FakeNotifications notifications;
    FakeProcessTable processes;
    FakeChanstat chanstat;
    std::shared_ptr<MxReportingServiceDelegate> root;
    std::vector<std::shared_ptr<FakeServiceConnection>> connections;

private:
    class NoListener final : public ServiceListener {
    public:
        void setDelegate(std::shared_ptr<ServiceListenerDelegate>) override {}
        void resume() override {}
    };

    std::function<void()> run_;
    NoListener listener_;
};

} // namespace mx::testing
