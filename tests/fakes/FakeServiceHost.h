#pragma once
// Fakes of the services the service root is handed: preferences the test fills,
// notifications the test delivers by hand, a process table the test scripts, and a
// connection that records what the root set up on it.

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "platform/ProcessTable.h"
#include "platform/ServiceConnection.h"

namespace mx::testing {

class FakePreferences final : public Preferences {
public:
    Dictionary copyDomain(const std::string& domain) override { return domains[domain]; }
    std::map<std::string, Dictionary> domains;
};

class FakeNotifications final : public Notifications {
public:
    std::uint32_t registerDispatch(const std::string& name, int& token, std::shared_ptr<WorkQueue> queue,
                                   std::function<void(int)> handler) override
    {
        token = static_cast<int>(registrations.size()) + 41;
        registrations.push_back({name, token, std::move(queue), std::move(handler)});
        return 0;
    }
    std::uint32_t post(const std::string& name) override
    {
        for (auto& registration : registrations)
            if (registration.name == name)
                deliver(registration.token);
        return 0;
    }
    // Delivers as the notification service would, with whatever token the test names.
    void deliver(int token)
    {
        for (auto& registration : registrations)
            registration.queue->dispatch([handler = registration.handler, token] { handler(token); });
    }

    struct Registration {
        std::string name;
        int token;
        std::shared_ptr<WorkQueue> queue;
        std::function<void(int)> handler;
    };
    std::vector<Registration> registrations;
};

class FakeProcessTable final : public ProcessTable {
public:
    std::optional<std::string> processName(pid_t pid) override
    {
        auto found = names.find(pid);
        return found == names.end() ? std::nullopt : std::optional<std::string>(found->second);
    }
    pid_t ownProcessIdentifier() override { return 1000; }
    std::string ownProcessName() override { return "mxreportingd"; }
    std::map<pid_t, std::string> names;
};

class FakeServiceConnection final : public ServiceConnection {
public:
    explicit FakeServiceConnection(pid_t pid) : pid_(pid) {}
    pid_t processIdentifier() const override { return pid_; }
    std::string description() const override { return "<fake connection " + std::to_string(pid_) + ">"; }
    void setExportedObject(std::shared_ptr<ServiceExportedObject> object) override { exported = std::move(object); }
    void setInterruptionHandler(std::function<void()> handler) override { interruption = std::move(handler); }
    void setInvalidationHandler(std::function<void()> handler) override { invalidation = std::move(handler); }
    void resume() override { resumed = true; }

    std::shared_ptr<ServiceExportedObject> exported;
    std::function<void()> interruption;
    std::function<void()> invalidation;
    bool resumed = false;

private:
    pid_t pid_;
};

} // namespace mx::testing
