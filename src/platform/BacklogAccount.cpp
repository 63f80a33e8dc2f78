#include "platform/BacklogAccount.h"

#include <utility>

namespace mx {

namespace {

std::atomic<bool> forgiven{false};

// The accounts with waiters, for forgiveAll to reach: few, the clients held back now.
struct WaitingAccounts {
    std::mutex mutex;
    std::vector<std::weak_ptr<BacklogAccount>> accounts;

    void add(const std::weak_ptr<BacklogAccount>& account)
    {
        std::lock_guard lock(mutex);
        accounts.push_back(account);
    }
    void remove(const BacklogAccount* account)
    {
        std::lock_guard lock(mutex);
        std::erase_if(accounts, [&](const auto& weak) {
            auto held = weak.lock();
            return !held || held.get() == account;
        });
    }
};

WaitingAccounts& waitingAccounts()
{
    static auto* accounts = new WaitingAccounts; // outlives every settling thread
    return *accounts;
}

} // namespace

bool BacklogAccount::overdrawn() const { return !forgiven.load() && owed() > bound_; }

void BacklogAccount::whenSettled(UniqueFunction<void()> resume)
{
    bool first = false;
    {
        std::lock_guard lock(waitersMutex_);
        waiters_.push_back(std::move(resume));
        first = !waiting_.exchange(true);
    }
    if (first)
        waitingAccounts().add(weak_from_this());
    // Settled meanwhile, or never to wait again: nobody else would run it.
    if (forgiven.load() || owed() <= bound_ / 2)
        runWaiters();
}

void BacklogAccount::forgiveAll()
{
    forgiven.store(true);
    std::vector<std::weak_ptr<BacklogAccount>> accounts;
    {
        auto& waiting = waitingAccounts();
        std::lock_guard lock(waiting.mutex);
        accounts.swap(waiting.accounts);
    }
    for (const auto& weak : accounts)
        if (auto account = weak.lock())
            account->runWaiters();
}

void BacklogAccount::charge(std::size_t bytes) { owed_.fetch_add(bytes); }

void BacklogAccount::settle(std::size_t bytes)
{
    std::size_t left = owed_.fetch_sub(bytes) - bytes;
    if (left <= bound_ / 2 && waiting_.load())
        runWaiters();
}

void BacklogAccount::runWaiters()
{
    std::vector<UniqueFunction<void()>> waiters;
    {
        std::lock_guard lock(waitersMutex_);
        if (!waiting_.exchange(false))
            return;
        waiters.swap(waiters_);
    }
    waitingAccounts().remove(this);
    for (auto& resume : waiters)
        resume();
}

BacklogDebt BacklogDebt::incur(std::size_t bytes)
{
    const auto& named = ScopedBacklogAccount::current();
    if (!named.account)
        return {};
    return BacklogDebt(named.account, named.weight, named.weight + BacklogAccount::kChargeOverhead + bytes);
}

BacklogDebt::BacklogDebt(std::shared_ptr<BacklogAccount> account, std::size_t weight, std::size_t bytes)
    : account_(std::move(account)), weight_(weight), bytes_(bytes)
{
    account_->charge(bytes_);
}

BacklogDebt::~BacklogDebt()
{
    if (account_)
        account_->settle(bytes_);
}

BacklogDebt::BacklogDebt(BacklogDebt&& other) noexcept
    : account_(std::move(other.account_)), weight_(other.weight_), bytes_(other.bytes_)
{
}

BacklogDebt& BacklogDebt::operator=(BacklogDebt&& other) noexcept
{
    if (this != &other) {
        if (account_)
            account_->settle(bytes_);
        account_ = std::move(other.account_);
        weight_ = other.weight_;
        bytes_ = other.bytes_;
    }
    return *this;
}

ScopedBacklogAccount::Named& ScopedBacklogAccount::current()
{
    thread_local Named named;
    return named;
}

ScopedBacklogAccount::ScopedBacklogAccount(std::shared_ptr<BacklogAccount> account, std::size_t weight)
    : previous_(std::exchange(current(), Named{std::move(account), weight}))
{
}

ScopedBacklogAccount::ScopedBacklogAccount(const BacklogDebt& debt) : ScopedBacklogAccount(debt.account_, debt.weight_)
{
}

ScopedBacklogAccount::~ScopedBacklogAccount() { current() = std::move(previous_); }

} // namespace mx
