#pragma once
// Reads the MessagePack headers of a byte stream as the bytes arrive, before any
// parser allocates for them, and refuses a header that declares more than the
// message can still hold: a container needs at least a byte per element, a string,
// binary or extension its whole length, and nesting has a depth limit. A forged
// header then costs its sender the connection, not the daemon gigabytes of memory.
// Not thread-safe; one per stream.

#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace mx {

class MsgpackSizeGuard {
public:
    MsgpackSizeGuard(std::size_t maximumMessageBytes, std::size_t maximumDepth);

    // Checks the next bytes of the stream. False, with `reason`, at the first header
    // that breaks a limit; the stream cannot be trusted after that.
    bool check(std::span<const char> bytes, std::string& reason);

private:
    // What follows the first byte of a header before its payload, and what that is.
    enum class Kind : std::uint8_t { Scalar, Payload, Array, Map };
    struct Layout {
        Kind kind = Kind::Scalar;
        std::uint8_t lengthBytes = 0; // big-endian length or count after the first byte
        std::uint8_t fixedBytes = 0;  // further header bytes (an extension's type), or a scalar's value
        std::uint8_t fixedLength = 0;
    };
    static Layout layoutOf(std::uint8_t first);

    bool startElement(std::uint8_t first, std::string& reason);
    bool finishHeader(std::string& reason);
    bool expectPayload(std::uint64_t length, std::string& reason);
    bool openContainer(std::uint64_t elements, std::string& reason);
    void elementDone();
    std::uint64_t headerValue() const;

    const std::size_t maximumMessageBytes_;
    const std::size_t maximumDepth_;
    std::size_t messageBytes_ = 0;
    // Elements still to come in each open container, outermost first.
    std::vector<std::uint64_t> remaining_;
    // A header whose length or count bytes are still arriving.
    Layout layout_;
    std::uint8_t header_[8] = {};
    std::size_t headerHave_ = 0;
    std::size_t headerNeed_ = 0;
    // Payload bytes of a string, binary or extension still to pass.
    std::uint64_t skip_ = 0;
};

} // namespace mx
