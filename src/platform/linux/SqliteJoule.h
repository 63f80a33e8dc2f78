#pragma once
// The power log on this host: every registered event goes to joule.db.

#include <filesystem>
#include <memory>

#include "platform/Joule.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

struct StoreLimit;

class SqliteJoule final : public Joule {
public:
    static std::unique_ptr<SqliteJoule> open(const std::filesystem::path& database, const StoreLimit& limit);

    void logRegisteredEvent(std::int32_t agent, std::string_view name, Dictionary event,
                            const Dictionary* options) override;
    SqliteStore& store() { return *store_; }

private:
    explicit SqliteJoule(std::unique_ptr<SqliteStore> store) : store_(std::move(store)) {}

    std::unique_ptr<SqliteStore> store_;
};

} // namespace mx
