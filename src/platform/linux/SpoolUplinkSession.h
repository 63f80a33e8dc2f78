#pragma once
// One backend session of the embedded spool backend (see SpoolUplink).

#include <memory>

#include "platform/Uplink.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

class SpoolUplink;

class SpoolUplinkSession final : public UplinkSession {
public:
    SpoolUplinkSession(std::shared_ptr<SpoolUplink> uplink, std::int64_t id, Dictionary sessionInfo,
                       Dictionary userInfo);

    void startConfiguration(UniqueFunction<void(std::optional<std::vector<std::string>>)> completion) override;
    void flushMessages(UniqueFunction<void(std::optional<UplinkError>)> completion) override;
    bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                     std::optional<UplinkError>& error) override;
    std::string description() const override;

private:
    SqliteWrite messageRow(std::uint16_t category, std::uint16_t type, const Dictionary& payload) const;

    const std::shared_ptr<SpoolUplink> uplink_;
    SqliteStore& store_;
    const std::int64_t id_;
    const bool realtime_;
};

} // namespace mx
