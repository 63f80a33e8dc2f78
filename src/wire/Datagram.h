#pragma once
// The sending end of the daemon's datagram endpoints, for whoever posts to them: a
// notification is its name as one datagram to run/harmonia/notify.sock; an orientation
// change goes to the orientation feed (OrientationDatagram).

#include <cstdint>
#include <filesystem>
#include <string_view>

namespace mx {

// Sends `datagram` to the Unix datagram socket at `endpoint`: 0, or the errno of the
// failure (ECONNREFUSED or ENOENT: nobody is bound there).
std::uint32_t sendDatagram(const std::filesystem::path& endpoint, std::string_view datagram);

// Posts the notification `name` to the daemon under the root: 0, or the errno.
std::uint32_t postNotification(std::string_view name);

} // namespace mx
