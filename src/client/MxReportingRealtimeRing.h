#pragma once
// The hand-over of real-time reports: a bounded ring of fixed slots, made once, into
// which any number of threads copy reports (already encoded as their MessagePack
// payload) and from which the client's own thread takes them. A producer never
// allocates, never takes a lock and makes no system call but, when the consumer
// sleeps, one write(2) to the ring's eventfd; a full ring drops the report and counts
// it. The slots are Vyukov's bounded queue: each has a sequence number that says
// whether it is free for the producer that claimed its position, or filled for the
// consumer.
// Owned by its client; push() from any thread, the rest from the consumer's thread.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "mxreporting/mxreporting.h"

namespace mx {

class MxReportingRealtimeRing {
public:
    static constexpr std::size_t kSlots = MXR_RT_SLOTS;
    static constexpr std::size_t kSlotBytes = MXR_RT_SLOT_BYTES;

    struct Report {
        std::int64_t reporterID;
        std::uint32_t category;
        std::uint16_t type;
        std::span<const std::uint8_t> payload; // a MessagePack map
    };

    // The eventfd is made here; nothing at all when it cannot be (with the errno).
    static std::unique_ptr<MxReportingRealtimeRing> make(int& error);
    ~MxReportingRealtimeRing();
    MxReportingRealtimeRing(const MxReportingRealtimeRing&) = delete;
    MxReportingRealtimeRing& operator=(const MxReportingRealtimeRing&) = delete;

    // 0, -EAGAIN (full: dropped and counted), -EMSGSIZE or -EINVAL.
    int push(std::int64_t reporterID, std::uint32_t category, std::uint16_t type, const mxr_field* fields,
             std::size_t count);

    // The consumer's side. `take` is called for each report in the ring, at most
    // `most` of them, in the order they were claimed; a report's payload is valid only
    // during its call.
    template <class Take>
    void drain(std::size_t most, Take&& take)
    {
        for (std::size_t taken = 0; taken < most; ++taken) {
            Slot& slot = slots_[consumed_ % kSlots];
            if (slot.sequence.load(std::memory_order_acquire) != consumed_ + 1)
                return;
            take(Report{slot.reporterID, slot.category, slot.type,
                        std::span<const std::uint8_t>(slot.payload, slot.length)});
            slot.sequence.store(consumed_ + kSlots, std::memory_order_release);
            ++consumed_;
        }
    }
    // Before the consumer waits on the eventfd: false when a report came meanwhile (it
    // must drain again rather than wait).
    bool prepareToWait();
    // Clears the eventfd once it was readable.
    void acknowledgeWake();
    int wakeDescriptor() const { return eventfd_; }

    std::uint64_t dropped() const { return dropped_.load(std::memory_order_relaxed); }

private:
    struct Slot {
        std::atomic<std::size_t> sequence;
        std::int64_t reporterID;
        std::uint32_t category;
        std::uint16_t type;
        std::uint16_t length;
        std::uint8_t payload[kSlotBytes];
    };

    explicit MxReportingRealtimeRing(int eventfd);

    std::unique_ptr<Slot[]> slots_;
    alignas(64) std::atomic<std::size_t> claimed_{0}; // the next position a producer claims
    alignas(64) std::size_t consumed_ = 0;            // the consumer's only
    alignas(64) std::atomic<bool> consumerWaiting_{false};
    std::atomic<std::uint64_t> dropped_{0};
    int eventfd_;
};

} // namespace mx
