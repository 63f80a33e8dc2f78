#include "MxReportStoreView.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <optional>
#include <system_error>
#include <unistd.h>
#include <vector>

#include <fmt/format.h>
#include <nlohmann/json.hpp>
#include <sqlite3.h>

#include "value/Value.h"
#include "wire/FileOwnership.h"

namespace mx {

namespace {

struct View {
    const char* database;
    const char* sql; // newest first, limited by ?1
    std::vector<const char*> columns;
};

const View* viewFor(const std::string& store)
{
    static const View events{"tally.db",
                             "SELECT id, time, name, payload FROM events ORDER BY id DESC LIMIT ?1",
                             {"id", "time", "name", "payload"}};
    static const View power{"joule.db",
                            "SELECT id, time, agent, name, payload FROM events ORDER BY id DESC LIMIT ?1",
                            {"id", "time", "agent", "name", "payload"}};
    static const View sessions{"uplink.db",
                               "SELECT id, opened, flushed, session_info, user_info FROM sessions "
                               "ORDER BY id DESC LIMIT ?1",
                               {"id", "opened", "flushed", "session_info", "user_info"}};
    static const View messages{"uplink.db",
                               "SELECT id, session, time, category, type, payload FROM messages "
                               "ORDER BY id DESC LIMIT ?1",
                               {"id", "session", "time", "category", "type", "payload"}};
    if (store == "events")
        return &events;
    if (store == "power")
        return &power;
    if (store == "sessions")
        return &sessions;
    if (store == "messages")
        return &messages;
    return nullptr;
}

bool isTimeColumn(const char* column)
{
    return std::string_view(column) == "time" || std::string_view(column) == "opened" ||
        std::string_view(column) == "flushed";
}

nlohmann::ordered_json cell(sqlite3_stmt* statement, int column, const char* name)
{
    switch (sqlite3_column_type(statement, column)) {
    case SQLITE_NULL:
        return nullptr;
    case SQLITE_INTEGER:
        return sqlite3_column_int64(statement, column);
    case SQLITE_FLOAT: {
        double value = sqlite3_column_double(statement, column);
        if (isTimeColumn(name))
            return formatDate(
                Date(std::chrono::round<std::chrono::microseconds>(std::chrono::duration<double>(value))));
        return value;
    }
    default: {
        std::string text = reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
        auto parsed = nlohmann::ordered_json::parse(text, nullptr, false);
        return parsed.is_discarded() ? nlohmann::ordered_json(text) : parsed;
    }
    }
}

std::string plain(const nlohmann::ordered_json& value)
{
    return value.is_string() ? value.get<std::string>() : value.dump();
}

// What keeps this user from reading the store at `path`, said so that it can be mended.
std::optional<std::string> unreadable(const std::filesystem::path& path)
{
    if (::access(path.c_str(), R_OK) == 0)
        return std::nullopt;
    int error = errno;
    if (error == ENOENT)
        return fmt::format("{} does not exist: mxreportingd makes it when it starts (is MXREPORTING_ROOT right?)",
                           path.string());
    std::string group = owningGroup(path);
    if (error != EACCES || group.empty())
        return fmt::format("cannot read {}: {}", path.string(), std::generic_category().message(error));
    return fmt::format("cannot read {}: only its owner and group {} may; add this user to group {} (then log in again)",
                       path.string(), group, group);
}

} // namespace

int printStore(const std::filesystem::path& storeDirectory, const MxReportStoreQuery& query)
{
    const View* view = viewFor(query.store);
    if (!view)
        return 64;
    auto path = storeDirectory / view->database;
    if (auto problem = unreadable(path)) {
        std::fprintf(stderr, "mxreport: %s\n", problem->c_str());
        return 2;
    }
    sqlite3* database = nullptr;
    if (sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
        std::fprintf(stderr, "mxreport: cannot open %s: %s\n", path.c_str(), sqlite3_errmsg(database));
        sqlite3_close(database);
        return 2;
    }
    sqlite3_busy_timeout(database, 5000);
    sqlite3_stmt* statement = nullptr;
    std::vector<nlohmann::ordered_json> rows;
    if (sqlite3_prepare_v2(database, view->sql, -1, &statement, nullptr) == SQLITE_OK) {
        sqlite3_bind_int64(statement, 1, static_cast<sqlite3_int64>(query.limit));
        while (sqlite3_step(statement) == SQLITE_ROW) {
            nlohmann::ordered_json row = nlohmann::ordered_json::object();
            for (std::size_t i = 0; i < view->columns.size(); ++i)
                row[view->columns[i]] = cell(statement, static_cast<int>(i), view->columns[i]);
            rows.push_back(std::move(row));
        }
    } else {
        std::fprintf(stderr, "mxreport: %s: %s\n", path.c_str(), sqlite3_errmsg(database));
    }
    sqlite3_finalize(statement);
    sqlite3_close(database);
    std::reverse(rows.begin(), rows.end());

    if (query.json) {
        for (const auto& row : rows)
            std::puts(row.dump().c_str());
        return 0;
    }
    std::vector<std::size_t> widths;
    for (const char* column : view->columns)
        widths.push_back(std::string_view(column).size());
    for (const auto& row : rows)
        for (std::size_t i = 0; i + 1 < view->columns.size(); ++i)
            widths[i] = std::max(widths[i], plain(row[view->columns[i]]).size());
    auto printRow = [&](auto&& text) {
        std::string line;
        for (std::size_t i = 0; i < view->columns.size(); ++i)
            line += i + 1 < view->columns.size() ? fmt::format("{:<{}}  ", text(i), widths[i]) : text(i);
        std::puts(line.c_str());
    };
    printRow([&](std::size_t i) { return std::string(view->columns[i]); });
    for (const auto& row : rows)
        printRow([&](std::size_t i) { return plain(row[view->columns[i]]); });
    return 0;
}

std::optional<MxReportStoreQuery> parseStoreQuery(const std::vector<std::string>& words, std::string& error)
{
    static const std::vector<std::string> stores = {"events", "power", "sessions", "messages"};
    if (words.empty() || std::find(stores.begin(), stores.end(), words[0]) == stores.end()) {
        error = "the stores are events, power, sessions and messages";
        return std::nullopt;
    }
    MxReportStoreQuery query{words[0]};
    for (std::size_t i = 1; i < words.size(); ++i) {
        if (words[i] == "--json") {
            query.json = true;
            continue;
        }
        char* end = nullptr;
        if (words[i] == "--limit" && i + 1 < words.size()) {
            long long limit = std::strtoll(words[++i].c_str(), &end, 10);
            if (*end == '\0' && !words[i].empty()) {
                query.limit = static_cast<std::size_t>(std::max(0LL, limit));
                continue;
            }
        }
        error = fmt::format("{} takes --limit N and --json", words[0]);
        return std::nullopt;
    }
    return query;
}

} // namespace mx
