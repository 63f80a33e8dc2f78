#include "platform/linux/AsioHandOver.h"

namespace mx {

namespace {

thread_local AsioHandOver* innermost = nullptr;

} // namespace

AsioHandOver::AsioHandOver(const void* owner) : outer_(innermost), owner_(owner) { innermost = this; }

AsioHandOver::~AsioHandOver()
{
    // By index: a hand-over that runs its work inline may add more.
    for (std::size_t next = 0; next < handOvers_.size(); ++next) {
        auto handOver = std::move(handOvers_[next]);
        handOver();
    }
    innermost = outer_;
}

AsioHandOver* AsioHandOver::takingFrom(const void* giver, asio::io_context& target)
{
    if (innermost == nullptr || innermost->owner_ == giver || !target.get_executor().running_in_this_thread())
        return nullptr;
    return innermost;
}

AsioHandOver* AsioHandOver::ownedBy(const void* owner)
{
    for (AsioHandOver* handOver = innermost; handOver != nullptr; handOver = handOver->outer_)
        if (handOver->owner_ == owner)
            return handOver;
    return nullptr;
}

void AsioHandOver::add(UniqueFunction<void()> handOver) { handOvers_.push_back(std::move(handOver)); }

} // namespace mx
