#pragma once
// A row handed to a store (SqliteStore): which of its statements runs, with what.

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "platform/BacklogAccount.h"
#include "platform/ReplyGate.h"
#include "platform/UniqueFunction.h"
#include "value/Value.h"

namespace mx {

// A Dictionary parameter is written as its JSON text on the writer thread, off the
// caller's path; a deferred one is built there too, unless the row is kept in the
// store's pending rows, which needs it at once.
using SqliteDeferredDictionary = std::shared_ptr<UniqueFunction<Dictionary()>>;
using SqliteValue =
    std::variant<std::nullptr_t, std::int64_t, double, std::string, Dictionary, SqliteDeferredDictionary>;

struct SqliteWrite {
    std::size_t statement; // index into the statements given at open
    std::vector<SqliteValue> parameters;
    BacklogDebt debt = {}; // owed by the client whose request made the row, until committed
    // Its number among the store's pending rows (SqlitePendingRows), 0 when not kept there.
    std::uint64_t pending = 0;
    // A row kept nowhere yet holds its request's reply until it is committed.
    ReplyTicket ticket = {};
    // Wanted by a reader soon (a message a collector takes at once): committed within
    // the short window, and the store says when it is.
    bool soon = false;
};

} // namespace mx
