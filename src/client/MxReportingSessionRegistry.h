#pragma once
// What a client's sessions are, as its calls made them: created, typed, configured,
// started. It is what the library restores on a new connection when the old one broke
// (the daemon's sessions live and die with their connection), so that a daemon's
// restart is not its callers' problem. It follows the daemon's own rules: reporter 0
// is created but never typed or started, a create replaces, a configuration merges.
// Owned by its connection; its thread only.

#include <cstdint>
#include <map>
#include <optional>
#include <string_view>
#include <vector>

#include "value/Value.h"

namespace mx {

// What one request does to the session it names.
struct MxReportingSessionEffect {
    enum class Kind { None, Create, SetServiceType, SetConfiguration, Start, Stop, Destroy };
    Kind kind = Kind::None;
    std::int64_t reporterID = 0;
    std::uint16_t serviceType = 0;
    Dictionary configuration;
};

class MxReportingSessionRegistry {
public:
    // A request, as the restore sends it.
    struct Request {
        std::string_view method;
        Array params;
    };

    // The create's number when `effect` made a session, else 0.
    std::uint64_t apply(const MxReportingSessionEffect& effect);
    // A create the daemon refused: the session it made here is not restored, unless a
    // later create made it again.
    void forget(std::int64_t reporterID, std::uint64_t created);
    // The requests that make the sessions again, in order, on a connection that has none.
    std::vector<Request> restoration() const;
    std::size_t size() const { return sessions_.size(); }

private:
    struct Session {
        std::uint64_t created; // the order sessions are made again in
        std::optional<std::uint16_t> serviceType;
        Dictionary configuration;
        bool started = false;
    };

    std::map<std::int64_t, Session> sessions_;
    std::uint64_t creations_ = 0;
};

} // namespace mx
