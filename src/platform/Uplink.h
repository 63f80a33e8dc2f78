#pragma once
// Uplink: the real-time reporting backend. A backend session is opened with session
// and user information, finds its servers ("backends") asynchronously, takes
// messages and is flushed at the end; one-shot messages carry their own session
// description. The key constants below are the backend's published names.

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/ProcessWide.h"
#include "platform/UniqueFunction.h"
#include "value/Value.h"

namespace mx {

inline constexpr const char* kUplinkSessionInfoClientType = "ClientType";
inline constexpr const char* kUplinkSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kUplinkSessionInfoSessionID = "SessionID";
inline constexpr const char* kUplinkSessionInfoBatchEvent = "BatchEvent";
inline constexpr const char* kUplinkSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr const char* kUplinkSessionInfoContainsRealtimeEvents = "ContainsRealtimeEvents";
inline constexpr const char* kUplinkUserInfoClientName = "ClientName";
inline constexpr const char* kUplinkUserInfoServiceName = "ServiceName";

// Names one backend session within the hierarchy of a client's reporting.
struct UplinkSecureHierarchyToken {
    std::array<std::uint8_t, 16> uuid{};
    std::string text() const; // the canonical 8-4-4-4-12 form
};

struct UplinkError {
    std::int64_t code = 0;
    std::string description;
};

class UplinkSession {
public:
    virtual ~UplinkSession() = default;
    // Returns at once; `completion` runs once, with the backends that answered
    // (possibly none) or with nothing when discovery failed: in place, when the
    // backends' answer is known already, else later, on a backend thread.
    virtual void startConfiguration(UniqueFunction<void(std::optional<std::vector<std::string>>)> completion) = 0;
    // Sends whatever the session still holds; `completion` runs once, on a backend
    // thread, with the error or nothing.
    virtual void flushMessages(UniqueFunction<void(std::optional<UplinkError>)> completion) = 0;
    // Hands one message to the session; false (and `error` set when known) if refused.
    virtual bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                             std::optional<UplinkError>& error) = 0;
    virtual std::string description() const = 0;
};

class Uplink {
public:
    virtual ~Uplink() = default;
    virtual UplinkSecureHierarchyToken newSecureHierarchyToken(const UplinkSecureHierarchyToken* parent) = 0;
    virtual std::shared_ptr<UplinkSession> makeSession(Dictionary sessionInfo, Dictionary userInfo,
                                                       std::vector<std::string> frameworksToCheck) = 0;
    // A message with a throw-away session of its own; false (and `error` set when
    // known) if refused. Callable from any thread.
    virtual bool sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category, std::uint16_t type,
                                Dictionary payload, std::optional<UplinkError>& error) = 0;
};

} // namespace mx
