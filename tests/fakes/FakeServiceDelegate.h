#pragma once
// A service root for endpoint tests: a client list the test fills, a reporting
// switch and defaults the test sets, and driver statistics it scripts. The
// cross-client lookup follows the root's rules (nothing for ID 0 or while reporting
// is off; first client in connection order wins).

#include <memory>
#include <optional>
#include <vector>

#include "Statistics/Service/MxReportingServerInstance.h"
#include "Statistics/Service/MxReportingServiceDelegateProtocol.h"

namespace mx::testing {

class FakeServiceDelegate final : public MxReportingServiceDelegateProtocol {
public:
    std::optional<Dictionary> getDefaults() override { return defaults; }
    const std::vector<std::shared_ptr<MxReportingServerInstance>>& getAllClients() override { return clients; }
    bool isReportingEnabled() override { return reportingEnabled; }
    std::shared_ptr<MxReportingSession> findReportingSessionForID(ReporterID reporterID) override;
    std::shared_ptr<MxReportingDriverSnapShot> getSnapShot() override;
    std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
        const std::shared_ptr<MxReportingDriverSnapShot>& snapShot) override;
    void removeClient(const MxReportingServerInstance& client) override;

    std::vector<std::shared_ptr<MxReportingServerInstance>> clients;
    bool reportingEnabled = true;
    std::optional<Dictionary> defaults;
    std::optional<Dictionary> driverStatistics;
    int snapShotsTaken = 0;
    std::vector<std::shared_ptr<MxReportingDriverSnapShot>> statisticsAskedAgainst;
    int removals = 0;
};

} // namespace mx::testing
