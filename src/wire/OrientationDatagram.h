#pragma once
// The orientation feed's vocabulary, shared by the daemon that binds the feed and the
// tools that post to it: one change per datagram, "device N" or "ui N" (N a decimal
// integer), and the texts of the orientation values.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace mx {

enum class OrientationKind { Device, UI };

struct OrientationChange {
    OrientationKind kind;
    int orientation;
};

// Nothing for anything but "device N" or "ui N"; one trailing newline is allowed, so
// that a line written by a shell tool is a change too.
std::optional<OrientationChange> parseOrientationDatagram(std::string_view datagram);
std::string formatOrientationDatagram(const OrientationChange& change);
// Posts `change` to the daemon's orientation feed under the root: 0, or the errno.
std::uint32_t postOrientationChange(const OrientationChange& change);

// 0 "unknown", 1 "portrait" ... 6 "face-down"; any other value is "unknown".
std::string_view orientationText(int orientation);
// The value of a text, or of a decimal number; nothing for anything else.
std::optional<int> orientationFromText(std::string_view text);

} // namespace mx
