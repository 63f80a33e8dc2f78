#include "wire/MsgpackSizeGuard.h"

#include <algorithm>

#include <fmt/format.h>

namespace mx {

MsgpackSizeGuard::Layout MsgpackSizeGuard::layoutOf(std::uint8_t first)
{
    if (first <= 0x7f || first >= 0xe0)
        return {};
    if (first <= 0x8f)
        return {Kind::Map, 0, 0, static_cast<std::uint8_t>(first & 0x0fu)};
    if (first <= 0x9f)
        return {Kind::Array, 0, 0, static_cast<std::uint8_t>(first & 0x0fu)};
    if (first <= 0xbf)
        return {Kind::Payload, 0, 0, static_cast<std::uint8_t>(first & 0x1fu)};
    switch (first) {
    case 0xc4:
        return {Kind::Payload, 1};
    case 0xc5:
        return {Kind::Payload, 2};
    case 0xc6:
        return {Kind::Payload, 4};
    case 0xc7:
        return {Kind::Payload, 1, 1};
    case 0xc8:
        return {Kind::Payload, 2, 1};
    case 0xc9:
        return {Kind::Payload, 4, 1};
    case 0xca:
        return {Kind::Scalar, 0, 4};
    case 0xcb:
        return {Kind::Scalar, 0, 8};
    case 0xcc:
    case 0xd0:
        return {Kind::Scalar, 0, 1};
    case 0xcd:
    case 0xd1:
        return {Kind::Scalar, 0, 2};
    case 0xce:
    case 0xd2:
        return {Kind::Scalar, 0, 4};
    case 0xcf:
    case 0xd3:
        return {Kind::Scalar, 0, 8};
    case 0xd4:
        return {Kind::Payload, 0, 1, 1};
    case 0xd5:
        return {Kind::Payload, 0, 1, 2};
    case 0xd6:
        return {Kind::Payload, 0, 1, 4};
    case 0xd7:
        return {Kind::Payload, 0, 1, 8};
    case 0xd8:
        return {Kind::Payload, 0, 1, 16};
    case 0xd9:
        return {Kind::Payload, 1};
    case 0xda:
        return {Kind::Payload, 2};
    case 0xdb:
        return {Kind::Payload, 4};
    case 0xdc:
        return {Kind::Array, 2};
    case 0xdd:
        return {Kind::Array, 4};
    case 0xde:
        return {Kind::Map, 2};
    case 0xdf:
        return {Kind::Map, 4};
    default:
        return {}; // nil, booleans, and 0xc1, which the parser refuses
    }
}

MsgpackSizeGuard::MsgpackSizeGuard(std::size_t maximumMessageBytes, std::size_t maximumDepth)
    : maximumMessageBytes_(maximumMessageBytes), maximumDepth_(maximumDepth)
{
}

bool MsgpackSizeGuard::check(std::span<const char> bytes, std::string& reason)
{
    std::size_t position = 0;
    while (position < bytes.size()) {
        if (skip_ > 0) {
            auto passed = static_cast<std::size_t>(std::min<std::uint64_t>(skip_, bytes.size() - position));
            skip_ -= passed;
            position += passed;
            messageBytes_ += passed;
            if (skip_ == 0)
                elementDone();
            continue;
        }
        auto byte = static_cast<std::uint8_t>(bytes[position++]);
        if (headerNeed_ == 0 && remaining_.empty())
            messageBytes_ = 0;
        if (++messageBytes_ > maximumMessageBytes_) {
            reason = "message larger than 1 MiB";
            return false;
        }
        if (headerNeed_ == 0) {
            if (!startElement(byte, reason))
                return false;
            continue;
        }
        header_[headerHave_++] = byte;
        if (headerHave_ == headerNeed_ && !finishHeader(reason))
            return false;
    }
    return true;
}

bool MsgpackSizeGuard::startElement(std::uint8_t first, std::string& reason)
{
    layout_ = layoutOf(first);
    headerHave_ = 0;
    headerNeed_ = std::size_t{layout_.lengthBytes} + layout_.fixedBytes;
    return headerNeed_ > 0 || finishHeader(reason);
}

std::uint64_t MsgpackSizeGuard::headerValue() const
{
    if (layout_.lengthBytes == 0)
        return layout_.fixedLength;
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < layout_.lengthBytes; ++i)
        value = (value << 8) | header_[i];
    return value;
}

bool MsgpackSizeGuard::finishHeader(std::string& reason)
{
    headerNeed_ = 0;
    switch (layout_.kind) {
    case Kind::Scalar:
        elementDone();
        return true;
    case Kind::Payload:
        return expectPayload(headerValue(), reason);
    case Kind::Array:
        return openContainer(headerValue(), reason);
    case Kind::Map:
        return openContainer(headerValue() * 2, reason);
    }
    return true;
}

bool MsgpackSizeGuard::expectPayload(std::uint64_t length, std::string& reason)
{
    if (length > maximumMessageBytes_ - messageBytes_) {
        reason = fmt::format("message larger than 1 MiB (a header declares {} bytes)", length);
        return false;
    }
    skip_ = length;
    if (skip_ == 0)
        elementDone();
    return true;
}

bool MsgpackSizeGuard::openContainer(std::uint64_t elements, std::string& reason)
{
    if (elements > maximumMessageBytes_ - messageBytes_) {
        reason = fmt::format("message larger than 1 MiB (a header declares {} elements)", elements);
        return false;
    }
    if (remaining_.size() + 1 > maximumDepth_) {
        reason = fmt::format("nesting deeper than {}", maximumDepth_);
        return false;
    }
    if (elements == 0) {
        elementDone();
        return true;
    }
    remaining_.push_back(elements);
    return true;
}

void MsgpackSizeGuard::elementDone()
{
    // A finished element may finish its container, and that one its own.
    while (!remaining_.empty()) {
        if (--remaining_.back() > 0)
            return;
        remaining_.pop_back();
    }
}

} // namespace mx
