#pragma once
// Named system notifications: any process posts a name; every registration for that
// name is told, on the queue it chose, with its own registration token.

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/WorkQueue.h"

namespace mx {

class Notifications {
public:
    virtual ~Notifications() = default;
    // Status 0 on success; `token` identifies the registration and is passed to
    // `handler`, which runs on `queue` once per delivered post.
    virtual std::uint32_t registerDispatch(const std::string& name, int& token, std::shared_ptr<WorkQueue> queue,
                                           std::function<void(int token)> handler) = 0;
    virtual std::uint32_t post(const std::string& name) = 0;
};

} // namespace mx
