#pragma once
// A backend that records every session, message, flush and one-shot send, and
// answers discovery the way the test chooses: at once with backends, at once with
// nothing, or only when the test calls answerDiscovery().

#include <atomic>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/Uplink.h"

namespace mx::testing {

struct UplinkSentMessage {
    std::uint16_t category;
    std::uint16_t type;
    Dictionary payload;
};

struct UplinkOneShot {
    Dictionary sessionInfo;
    Dictionary userInfo;
    std::uint16_t category;
    std::uint16_t type;
    Dictionary payload;
};

class FakeUplink;

class FakeUplinkSession final : public UplinkSession {
public:
    FakeUplinkSession(FakeUplink& uplink, int number, Dictionary sessionInfo, Dictionary userInfo);

    void startConfiguration(UniqueFunction<void(std::optional<std::vector<std::string>>)> completion) override;
    void flushMessages(UniqueFunction<void(std::optional<UplinkError>)> completion) override;
    bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                     std::optional<UplinkError>& error) override;
    std::string description() const override { return "FakeUplinkSession#" + std::to_string(number_); }

    const Dictionary sessionInfo;
    const Dictionary userInfo;
    std::vector<UplinkSentMessage> messages() const;
    int flushes() const;
    // Answers a held discovery; false when none is held.
    bool answerDiscovery(std::optional<std::vector<std::string>> backends);

private:
    FakeUplink& uplink_;
    int number_;
    mutable std::mutex mutex_;
    std::vector<UplinkSentMessage> messages_;
    int flushes_ = 0;
    UniqueFunction<void(std::optional<std::vector<std::string>>)> heldDiscovery_;
};

class FakeUplink final : public Uplink {
public:
    enum class Discovery { Backends, NoBackends, Held };

    UplinkSecureHierarchyToken newSecureHierarchyToken(const UplinkSecureHierarchyToken* parent) override;
    std::shared_ptr<UplinkSession> makeSession(Dictionary sessionInfo, Dictionary userInfo,
                                               std::vector<std::string> frameworksToCheck) override;
    bool sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category, std::uint16_t type,
                        Dictionary payload, std::optional<UplinkError>& error) override;

    void setDiscovery(Discovery discovery) { discovery_ = discovery; }
    Discovery discovery() const { return discovery_; }
    void setOneShotResult(bool accepted, std::optional<UplinkError> error);
    void setFlushError(std::optional<UplinkError> error);
    std::optional<UplinkError> flushError() const;

    std::vector<std::shared_ptr<FakeUplinkSession>> sessions() const;
    std::vector<UplinkOneShot> oneShots() const;
    int tokensIssued() const;
    // Blocks until `count` one-shot sends arrived or `timeout` passed.
    bool waitForOneShots(std::size_t count, std::chrono::milliseconds timeout) const;

private:
    std::atomic<Discovery> discovery_{Discovery::Backends};
    mutable std::mutex mutex_;
    mutable std::condition_variable changed_;
    std::vector<std::shared_ptr<FakeUplinkSession>> sessions_;
    std::vector<UplinkOneShot> oneShots_;
    bool oneShotAccepted_ = true;
    std::optional<UplinkError> oneShotError_;
    std::optional<UplinkError> flushError_;
    int tokens_ = 0;
};

} // namespace mx::testing
