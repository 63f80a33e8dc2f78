#include "fakes/FakeUplink.h"

namespace mx::testing {

FakeUplinkSession::FakeUplinkSession(FakeUplink& uplink, int number, Dictionary givenSessionInfo,
                                     Dictionary givenUserInfo)
    : sessionInfo(std::move(givenSessionInfo)), userInfo(std::move(givenUserInfo)), uplink_(uplink), number_(number)
{
}

void FakeUplinkSession::startConfiguration(UniqueFunction<void(std::optional<std::vector<std::string>>)> completion)
{
    switch (uplink_.discovery()) {
    case FakeUplink::Discovery::Backends:
        completion(std::vector<std::string>{"spool"});
        break;
    case FakeUplink::Discovery::NoBackends:
        completion(std::nullopt);
        break;
    case FakeUplink::Discovery::Held: {
        std::lock_guard lock(mutex_);
        heldDiscovery_ = std::move(completion);
        break;
    }
    }
}

bool FakeUplinkSession::answerDiscovery(std::optional<std::vector<std::string>> backends)
{
    UniqueFunction<void(std::optional<std::vector<std::string>>)> completion;
    {
        std::lock_guard lock(mutex_);
        completion = std::move(heldDiscovery_);
    }
    if (!completion)
        return false;
    completion(std::move(backends));
    return true;
}

void FakeUplinkSession::flushMessages(UniqueFunction<void(std::optional<UplinkError>)> completion)
{
    {
        std::lock_guard lock(mutex_);
        ++flushes_;
    }
    completion(uplink_.flushError());
}

bool FakeUplinkSession::sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                                    std::optional<UplinkError>&)
{
    std::lock_guard lock(mutex_);
    messages_.push_back({category, type, payload});
    return true;
}

std::vector<UplinkSentMessage> FakeUplinkSession::messages() const
{
    std::lock_guard lock(mutex_);
    return messages_;
}

int FakeUplinkSession::flushes() const
{
    std::lock_guard lock(mutex_);
    return flushes_;
}

UplinkSecureHierarchyToken FakeUplink::newSecureHierarchyToken(const UplinkSecureHierarchyToken*)
{
    std::lock_guard lock(mutex_);
    UplinkSecureHierarchyToken token;
    token.uuid[15] = static_cast<std::uint8_t>(++tokens_);
    return token;
}

std::shared_ptr<UplinkSession> FakeUplink::makeSession(Dictionary sessionInfo, Dictionary userInfo,
                                                       std::vector<std::string>)
{
    std::lock_guard lock(mutex_);
    auto session = std::make_shared<FakeUplinkSession>(*this, static_cast<int>(sessions_.size()) + 1,
                                                       std::move(sessionInfo), std::move(userInfo));
    sessions_.push_back(session);
    return session;
}

bool FakeUplink::sendOneMessage(Dictionary sessionInfo, Dictionary userInfo, std::uint16_t category, std::uint16_t type,
                                Dictionary payload, std::optional<UplinkError>& error)
{
    std::lock_guard lock(mutex_);
    oneShots_.push_back({std::move(sessionInfo), std::move(userInfo), category, type, std::move(payload)});
    changed_.notify_all();
    error = oneShotError_;
    return oneShotAccepted_;
}

void FakeUplink::setOneShotResult(bool accepted, std::optional<UplinkError> error)
{
    std::lock_guard lock(mutex_);
    oneShotAccepted_ = accepted;
    oneShotError_ = std::move(error);
}

void FakeUplink::setFlushError(std::optional<UplinkError> error)
{
    std::lock_guard lock(mutex_);
    flushError_ = std::move(error);
}

std::optional<UplinkError> FakeUplink::flushError() const
{
    std::lock_guard lock(mutex_);
    return flushError_;
}

std::vector<std::shared_ptr<FakeUplinkSession>> FakeUplink::sessions() const
{
    std::lock_guard lock(mutex_);
    return sessions_;
}

std::vector<UplinkOneShot> FakeUplink::oneShots() const
{
    std::lock_guard lock(mutex_);
    return oneShots_;
}

int FakeUplink::tokensIssued() const
{
    std::lock_guard lock(mutex_);
    return tokens_;
}

bool FakeUplink::waitForOneShots(std::size_t count, std::chrono::milliseconds timeout) const
{
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return oneShots_.size() >= count; });
}

} // namespace mx::testing
