#pragma once
// What one client has handed the daemon that is not written yet: the rows its requests
// queued for the stores, the deliveries and single messages waiting on queues. Each
// client's endpoint owns an account and takes no further request of its client while
// the account is overdrawn, so the back-pressure of slow stores falls on the clients
// that fill their queues and on no other. Work charges the account that the current
// thread names (ScopedBacklogAccount), in debts that settle themselves when what they
// stand for has been written or has run (BacklogDebt). Thread-safe.

#include <atomic>
#include <cstddef>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/UniqueFunction.h"

namespace mx {

class BacklogAccount : public std::enable_shared_from_this<BacklogAccount> {
public:
    // What one charge costs beyond the weight of the item it stands for: the row, the
    // queued closure, the bookkeeping.
    static constexpr std::size_t kChargeOverhead = 256;

    explicit BacklogAccount(std::size_t bound) : bound_(bound) {}

    std::size_t owed() const { return owed_.load(); }
    bool overdrawn() const;
    // Owes more than half its bound: one of the clients filling the queues.
    bool owesMuch() const { return owed() > bound_ / 2; }
    // Runs `resume` once the account owes at most half its bound: on the thread that
    // settles it that far, or here, at once, when it does already. The account must be
    // held by a shared_ptr.
    void whenSettled(UniqueFunction<void()> resume);

    // From now on no account is overdrawn and every waiter runs: a daemon shutting
    // down lets each client's requests already taken run to their end. For good.
    static void forgiveAll();

private:
    friend class BacklogDebt;
    void charge(std::size_t bytes);
    void settle(std::size_t bytes);
    void runWaiters();

    const std::size_t bound_;
    std::atomic<std::size_t> owed_{0};
    std::atomic<bool> waiting_{false}; // some waiter is registered
    std::mutex waitersMutex_;
    std::vector<UniqueFunction<void()>> waiters_;
};

// A charge on an account, settled when it is destroyed. Move-only; an empty debt (no
// account was named) settles nothing.
class BacklogDebt {
public:
    BacklogDebt() = default;
    // Charges the account named on this thread, if any: its item weight, the overhead,
    // and `bytes` more.
    static BacklogDebt incur(std::size_t bytes = 0);
    ~BacklogDebt();
    BacklogDebt(BacklogDebt&& other) noexcept;
    BacklogDebt& operator=(BacklogDebt&& other) noexcept;
    BacklogDebt(const BacklogDebt&) = delete;
    BacklogDebt& operator=(const BacklogDebt&) = delete;

    // Its account is past its bound: its client waits for what it owes to be done.
    bool overdrawn() const { return account_ && account_->overdrawn(); }
    bool owesMuch() const { return account_ && account_->owesMuch(); }

private:
    friend class ScopedBacklogAccount;
    BacklogDebt(std::shared_ptr<BacklogAccount> account, std::size_t weight, std::size_t bytes);

    std::shared_ptr<BacklogAccount> account_;
    std::size_t weight_ = 0; // the item weight of the scope it was incurred in
    std::size_t bytes_ = 0;  // what it charged
};

// Names, for its lifetime, the account that work on this thread charges and what one
// item of that work weighs (the request's payload): set around a client's request,
// and around work the request left for later, from the debt that work carries.
class ScopedBacklogAccount {
public:
    ScopedBacklogAccount(std::shared_ptr<BacklogAccount> account, std::size_t weight);
    explicit ScopedBacklogAccount(const BacklogDebt& debt);
    ~ScopedBacklogAccount();
    ScopedBacklogAccount(const ScopedBacklogAccount&) = delete;
    ScopedBacklogAccount& operator=(const ScopedBacklogAccount&) = delete;

private:
    friend class BacklogDebt;
    struct Named {
        std::shared_ptr<BacklogAccount> account;
        std::size_t weight = 0;
    };
    static Named& current();

    Named previous_;
};

} // namespace mx
