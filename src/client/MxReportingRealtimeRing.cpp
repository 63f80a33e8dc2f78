#include "client/MxReportingRealtimeRing.h"

#include <cerrno>
#include <cstring>
#include <new>
#include <sys/eventfd.h>
#include <unistd.h>

namespace mx {

namespace {

// Writes a report's fields as one MessagePack map into a fixed buffer: no allocation,
// nothing but arithmetic and copies. The byte count, or 0 when they do not fit.
class FixedEncoder {
public:
    FixedEncoder(std::uint8_t* out, std::size_t capacity) : out_(out), capacity_(capacity) {}

    bool map(std::size_t entries)
    {
        if (entries < 16)
            return byte(static_cast<std::uint8_t>(0x80 | entries));
        return entries <= 0xFFFF && byte(0xde) && bigEndian(entries, 2);
    }
    bool text(const char* text)
    {
        std::size_t length = std::strlen(text);
        bool header = length < 32 ? byte(static_cast<std::uint8_t>(0xa0 | length))
            : length < 0x100      ? byte(0xd9) && bigEndian(length, 1)
            : length < 0x10000    ? byte(0xda) && bigEndian(length, 2)
                                  : false;
        return header && bytes(text, length);
    }
    bool integer(std::int64_t value)
    {
        if (value >= 0 && value < 128)
            return byte(static_cast<std::uint8_t>(value));
        if (value < 0 && value >= -32)
            return byte(static_cast<std::uint8_t>(value));
        return byte(0xd3) && bigEndian(static_cast<std::uint64_t>(value), 8);
    }
    bool real(double value)
    {
        std::uint64_t bits = 0;
        std::memcpy(&bits, &value, sizeof bits);
        return byte(0xcb) && bigEndian(bits, 8);
    }
    bool boolean(bool value) { return byte(value ? 0xc3 : 0xc2); }

    std::size_t size() const { return size_; }

private:
    bool byte(std::uint8_t value)
    {
        if (size_ == capacity_)
            return false;
        out_[size_++] = value;
        return true;
    }
    bool bigEndian(std::uint64_t value, int count)
    {
        for (int shift = 8 * (count - 1); shift >= 0; shift -= 8)
            if (!byte(static_cast<std::uint8_t>(value >> shift)))
                return false;
        return true;
    }
    bool bytes(const char* data, std::size_t length)
    {
        if (capacity_ - size_ < length)
            return false;
        std::memcpy(out_ + size_, data, length);
        size_ += length;
        return true;
    }

    std::uint8_t* out_;
    std::size_t capacity_;
    std::size_t size_ = 0;
};

// -EINVAL for fields no report can hold, -EMSGSIZE for a report too large for a slot,
// else the encoded length.
int encodeFields(const mxr_field* fields, std::size_t count, std::uint8_t* out, std::size_t capacity)
{
    if (count > 0 && !fields)
        return -EINVAL;
    FixedEncoder encoder(out, capacity);
    bool fits = encoder.map(count);
    for (std::size_t i = 0; i < count && fits; ++i) {
        const mxr_field& field = fields[i];
        if (!field.key || (field.kind == MXR_STRING && !field.value.s))
            return -EINVAL;
        fits = encoder.text(field.key);
        switch (field.kind) {
        case MXR_INT:
            fits = fits && encoder.integer(field.value.i);
            break;
        case MXR_DOUBLE:
            fits = fits && encoder.real(field.value.d);
            break;
        case MXR_STRING:
            fits = fits && encoder.text(field.value.s);
            break;
        case MXR_BOOL:
            fits = fits && encoder.boolean(field.value.b != 0);
            break;
        default:
            return -EINVAL;
        }
    }
    return fits ? static_cast<int>(encoder.size()) : -EMSGSIZE;
}

} // namespace

std::unique_ptr<MxReportingRealtimeRing> MxReportingRealtimeRing::make(int& error)
{
    int fd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (fd < 0) {
        error = errno;
        return nullptr;
    }
    return std::unique_ptr<MxReportingRealtimeRing>(new MxReportingRealtimeRing(fd));
}

MxReportingRealtimeRing::MxReportingRealtimeRing(int eventfd)
    : slots_(std::make_unique<Slot[]>(kSlots)), eventfd_(eventfd)
{
    for (std::size_t i = 0; i < kSlots; ++i)
        slots_[i].sequence.store(i, std::memory_order_relaxed);
}

MxReportingRealtimeRing::~MxReportingRealtimeRing() { ::close(eventfd_); }

int MxReportingRealtimeRing::push(std::int64_t reporterID, std::uint32_t category, std::uint16_t type,
                                  const mxr_field* fields, std::size_t count)
{
    // Sized on the stack first: a report that cannot be taken claims no slot.
    std::uint8_t encoded[kSlotBytes];
    int length = encodeFields(fields, count, encoded, sizeof encoded);
    if (length < 0)
        return length;

    std::size_t position = claimed_.load(std::memory_order_relaxed);
    Slot* slot = nullptr;
    for (;;) {
        slot = &slots_[position % kSlots];
        std::size_t sequence = slot->sequence.load(std::memory_order_acquire);
        auto lag = static_cast<std::ptrdiff_t>(sequence) - static_cast<std::ptrdiff_t>(position);
        if (lag == 0) {
            if (claimed_.compare_exchange_weak(position, position + 1, std::memory_order_relaxed))
                break;
        } else if (lag < 0) {
            dropped_.fetch_add(1, std::memory_order_relaxed);
            return -EAGAIN;
        } else {
            position = claimed_.load(std::memory_order_relaxed);
        }
    }
    slot->reporterID = reporterID;
    slot->category = category;
    slot->type = type;
    slot->length = static_cast<std::uint16_t>(length);
    std::memcpy(slot->payload, encoded, static_cast<std::size_t>(length));
    slot->sequence.store(position + 1, std::memory_order_release);

    // Either the consumer, about to wait, sees this report, or this sees it waiting:
    // the fences order the two threads' store-then-load on both sides.
    std::atomic_thread_fence(std::memory_order_seq_cst);
    if (consumerWaiting_.load(std::memory_order_relaxed) && consumerWaiting_.exchange(false)) {
        std::uint64_t one = 1;
        // A full counter (it never is: the consumer clears it) would refuse, harmlessly.
        [[maybe_unused]] auto written = ::write(eventfd_, &one, sizeof one);
    }
    return 0;
}

bool MxReportingRealtimeRing::prepareToWait()
{
    consumerWaiting_.store(true, std::memory_order_relaxed);
    std::atomic_thread_fence(std::memory_order_seq_cst);
    const Slot& next = slots_[consumed_ % kSlots];
    if (next.sequence.load(std::memory_order_acquire) != consumed_ + 1)
        return true;
    consumerWaiting_.store(false, std::memory_order_relaxed);
    return false;
}

void MxReportingRealtimeRing::acknowledgeWake()
{
    std::uint64_t count = 0;
    [[maybe_unused]] auto read = ::read(eventfd_, &count, sizeof count);
}

} // namespace mx
