#pragma once
// Platform services that the daemon calls as process-wide functions (an analytics
// send, a trace point, a log line) reach the one implementation installed here.
// `main` installs the Linux implementations at start-up; a test fixture installs a
// fake for its own lifetime with ScopedInstall and gets the previous one back after.

#include <atomic>
#include <cassert>

namespace mx {

template <class Service>
class ProcessWide {
public:
    static Service& get()
    {
        Service* service = slot().load(std::memory_order_acquire);
        assert(service && "platform service used before one was installed");
        return *service;
    }

    static bool installed() { return slot().load(std::memory_order_acquire) != nullptr; }

    // Returns the implementation that was installed before.
    static Service* install(Service* service) { return slot().exchange(service, std::memory_order_acq_rel); }

private:
    static std::atomic<Service*>& slot()
    {
        static std::atomic<Service*> service{nullptr};
        return service;
    }
};

template <class Service>
class ScopedInstall {
public:
    explicit ScopedInstall(Service& service) : previous_(ProcessWide<Service>::install(&service)) {}
    ~ScopedInstall() { ProcessWide<Service>::install(previous_); }
    ScopedInstall(const ScopedInstall&) = delete;
    ScopedInstall& operator=(const ScopedInstall&) = delete;

private:
    Service* previous_;
};

} // namespace mx
