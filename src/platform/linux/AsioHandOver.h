#pragma once
// Work that a handler hands to another strand goes when the handler returns, and runs
// right there if that strand is idle. Posted, every hop from one strand to another
// (the connection's read to the server queue, the server queue's reply back to the
// connection) waited for a pass of the event loop, an epoll_wait of its own, which at
// everyday rates cost more than the hop's work. Handing over at the handler's end keeps
// what a strand promises: the strand's work runs one at a time, in the order given, and
// never inside the code that gave it (no lock of the giver is held then). What a handler
// gives its own strand is posted, behind the work already waiting there. Work run this
// way runs inside the giver's strand: work that waits (a declared blocking wait) would
// hold that strand meanwhile. Only the queues of one pool hand over in place, and the
// waits are all on the utility pool's session queues, which give each other nothing.
// One per running handler, on its thread; nested handlers nest.

#include <vector>

#include <asio/io_context.hpp>

#include "platform/UniqueFunction.h"

namespace mx {

class AsioHandOver {
public:
    // For the handler now running on this thread on behalf of `owner` (its queue or
    // connection: compared, never used).
    explicit AsioHandOver(const void* owner);
    // Hands over what was given meanwhile, in order, including what that gives.
    ~AsioHandOver();
    AsioHandOver(const AsioHandOver&) = delete;
    AsioHandOver& operator=(const AsioHandOver&) = delete;

    // The hand-over of the innermost handler running on this thread, for what `giver`
    // gives to a strand of `target`: none when no handler is open, when it is the giver's
    // own, or when this thread does not run `target` (the work could not run in place,
    // and held back it could fall behind work given later, a timer's). Then it posts.
    static AsioHandOver* takingFrom(const void* giver, asio::io_context& target);
    // The hand-over of a handler of `owner`'s running further up this thread's stack, if
    // any: what `owner` gives its own strand meanwhile can wait for that handler's end.
    static AsioHandOver* ownedBy(const void* owner);
    // `handOver` dispatches the work to its strand.
    void add(UniqueFunction<void()> handOver);

private:
    AsioHandOver* outer_;
    const void* owner_;
    std::vector<UniqueFunction<void()>> handOvers_;
};

} // namespace mx
