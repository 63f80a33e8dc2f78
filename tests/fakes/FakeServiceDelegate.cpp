#include "fakes/FakeServiceDelegate.h"

#include <algorithm>

namespace mx::testing {

std::shared_ptr<MxReportingSession> FakeServiceDelegate::findReportingSessionForID(ReporterID reporterID)
{
    if (reporterID == 0 || !reportingEnabled)
        return nullptr;
    for (const auto& client : clients) {
        const auto& sessions = client->clientReportingSessionMap();
        if (auto found = sessions.find(reporterID); found != sessions.end())
            return found->second;
    }
    return nullptr;
}

std::shared_ptr<MxReportingDriverSnapShot> FakeServiceDelegate::getSnapShot()
{
    ++snapShotsTaken;
    auto snapShot = std::make_shared<MxReportingDriverSnapShot>();
    (*snapShot)["Speaker-(null)"] = {ChanstatChannel{"underruns", "Speaker/underruns", snapShotsTaken}};
    return snapShot;
}

std::optional<Dictionary> FakeServiceDelegate::getDriverStatisticsRelativeToSnapShot(
    const std::shared_ptr<MxReportingDriverSnapShot>& snapShot)
{
    statisticsAskedAgainst.push_back(snapShot);
    return driverStatistics;
}

void FakeServiceDelegate::removeClient(const MxReportingServerInstance& client)
{
    ++removals;
    std::erase_if(clients, [&](const auto& candidate) { return candidate.get() == &client; });
}

} // namespace mx::testing
