#include "platform/ReplyGate.h"

#include <utility>

namespace mx {

// The count holds one for the request's own work and one for each ticket out.
class ReplyGate {
public:
    explicit ReplyGate(UniqueFunction<void()> reply) : reply_(std::move(reply)) {}

    void hold() { holds_.fetch_add(1, std::memory_order_relaxed); }
    void release()
    {
        if (holds_.fetch_sub(1, std::memory_order_acq_rel) == 1 && !lost_.load(std::memory_order_acquire))
            std::exchange(reply_, nullptr)();
    }
    void lose()
    {
        lost_.store(true, std::memory_order_release);
        release();
    }

private:
    std::atomic<int> holds_{1};
    std::atomic<bool> lost_{false};
    UniqueFunction<void()> reply_;
};

namespace {

thread_local ScopedReplyGate* innermost = nullptr;

} // namespace

ReplyTicket ReplyTicket::take()
{
    if (!innermost)
        return {};
    auto gate = innermost->gate();
    gate->hold();
    return ReplyTicket(std::move(gate));
}

ReplyTicket::~ReplyTicket()
{
    if (gate_)
        std::exchange(gate_, nullptr)->lose();
}

ReplyTicket& ReplyTicket::operator=(ReplyTicket&& other) noexcept
{
    if (this != &other) {
        if (gate_)
            gate_->lose();
        gate_ = std::move(other.gate_);
    }
    return *this;
}

void ReplyTicket::giveBack()
{
    if (gate_)
        std::exchange(gate_, nullptr)->release();
}

ScopedReplyGate::ScopedReplyGate(UniqueFunction<void()> reply)
    : outer_(std::exchange(innermost, this)), reply_(std::move(reply)), ownsGate_(true)
{
}

ScopedReplyGate::ScopedReplyGate(const ReplyTicket& ticket)
    : outer_(std::exchange(innermost, this)), gate_(ticket.gate_), ownsGate_(false)
{
}

ScopedReplyGate::~ScopedReplyGate()
{
    innermost = outer_;
    if (!ownsGate_)
        return;
    if (gate_)
        gate_->release();
    else if (reply_)
        reply_();
}

std::shared_ptr<ReplyGate> ScopedReplyGate::gate()
{
    if (!gate_)
        gate_ = std::make_shared<ReplyGate>(std::move(reply_));
    return gate_;
}

} // namespace mx
