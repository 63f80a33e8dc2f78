#pragma once
// A request's reply held until what the request handed over is kept: its rows in
// their stores' pending rows or committed, its deliveries made. Work that cannot keep
// what it was given before it returns (a row that finds no room among the pending
// rows, a delivery that waits behind a backend's discovery) takes a ticket from the
// gate named on its thread, carries it with what it stands for, and gives it back once
// that is kept. The reply goes when the request's own work is done and every ticket is
// back: on whichever thread gives the last one back. A ticket dropped without being
// given back (what it stood for was lost: rows abandoned by a store closing on a
// failing disk) keeps the reply from ever going, as a reply must not say a report was
// taken that was not. Thread-safe. A request whose work takes no ticket replies in
// place, at the end of its scope, and costs no gate at all.

#include <atomic>
#include <memory>

#include "platform/UniqueFunction.h"

namespace mx {

class ReplyGate;

// A hold on a gate's reply: given back once what it stands for is kept. Move-only; an
// empty ticket (no gate was named) holds nothing.
class ReplyTicket {
public:
    ReplyTicket() = default;
    // A ticket of the gate named on this thread, if any.
    static ReplyTicket take();
    ~ReplyTicket();
    ReplyTicket(ReplyTicket&& other) noexcept = default;
    ReplyTicket& operator=(ReplyTicket&& other) noexcept;
    ReplyTicket(const ReplyTicket&) = delete;
    ReplyTicket& operator=(const ReplyTicket&) = delete;

    explicit operator bool() const { return gate_ != nullptr; }
    // What it stands for is kept.
    void giveBack();

private:
    friend class ScopedReplyGate;
    explicit ReplyTicket(std::shared_ptr<ReplyGate> gate) : gate_(std::move(gate)) {}
    std::shared_ptr<ReplyGate> gate_;
};

// Names, for its lifetime, the gate that work on this thread takes tickets from: the
// request's own (made with its reply, when the first ticket is taken), or the gate of
// a ticket whose work runs now, elsewhere, so that what that work hands over in turn
// holds the same reply.
class ScopedReplyGate {
public:
    // Around a request's work: `reply` goes when the scope ends and every ticket taken
    // within it is back.
    explicit ScopedReplyGate(UniqueFunction<void()> reply);
    // Around work that carries `ticket`.
    explicit ScopedReplyGate(const ReplyTicket& ticket);
    ~ScopedReplyGate();
    ScopedReplyGate(const ScopedReplyGate&) = delete;
    ScopedReplyGate& operator=(const ScopedReplyGate&) = delete;

private:
    friend class ReplyTicket;
    std::shared_ptr<ReplyGate> gate();

    ScopedReplyGate* outer_;
    UniqueFunction<void()> reply_; // until a gate is made for it
    std::shared_ptr<ReplyGate> gate_;
    bool ownsGate_;
};

} // namespace mx
