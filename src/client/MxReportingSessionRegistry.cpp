#include "client/MxReportingSessionRegistry.h"

#include <algorithm>

#include "wire/MxReportingMethods.h"

namespace mx {

std::uint64_t MxReportingSessionRegistry::apply(const MxReportingSessionEffect& effect)
{
    using Kind = MxReportingSessionEffect::Kind;
    if (effect.kind == Kind::Create) {
        sessions_[effect.reporterID] = Session{++creations_, std::nullopt, {}, false};
        return creations_;
    }
    auto found = sessions_.find(effect.reporterID);
    if (found == sessions_.end() || effect.reporterID == 0)
        return 0;
    Session& session = found->second;
    switch (effect.kind) {
    case Kind::SetServiceType:
        session.serviceType = effect.serviceType;
        break;
    case Kind::SetConfiguration:
        session.configuration.merge(effect.configuration);
        break;
    case Kind::Start:
        session.started = true;
        break;
    case Kind::Stop:
        session.started = false;
        break;
    case Kind::Destroy:
        sessions_.erase(found);
        break;
    case Kind::None:
    case Kind::Create:
        break;
    }
    return 0;
}

void MxReportingSessionRegistry::forget(std::int64_t reporterID, std::uint64_t created)
{
    auto found = sessions_.find(reporterID);
    if (found != sessions_.end() && found->second.created == created)
        sessions_.erase(found);
}

std::vector<MxReportingSessionRegistry::Request> MxReportingSessionRegistry::restoration() const
{
    std::vector<std::pair<std::int64_t, const Session*>> ordered;
    for (const auto& [id, session] : sessions_)
        ordered.emplace_back(id, &session);
    std::sort(ordered.begin(), ordered.end(),
              [](const auto& a, const auto& b) { return a.second->created < b.second->created; });
    std::vector<Request> requests;
    for (const auto& [id, session] : ordered) {
        requests.push_back({method::kCreateReportingSession, Array{id}});
        if (session->serviceType)
            requests.push_back({method::kSetServiceType, Array{*session->serviceType, id}});
        if (!session->configuration.empty())
            requests.push_back({method::kSetConfiguration, Array{session->configuration, id}});
        if (session->started)
            requests.push_back({method::kStartReportingSessionForID, Array{id}});
    }
    return requests;
}

} // namespace mx
