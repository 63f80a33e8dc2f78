#include "platform/linux/SqliteTally.h"
#include "platform/linux/StoreLimits.h"

#include <fstream>

#include <gtest/gtest.h>
#include <sqlite3.h>

#include "fakes/CapturingLogSink.h"

namespace mx::testing {
namespace {

class SqliteStoreTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "mxreporting-store-XXXXXX").string();
        directory = mkdtemp(pattern.data());
    }
    void TearDown() override { std::filesystem::remove_all(directory); }

    std::int64_t count(const std::string& sql)
    {
        sqlite3* database = nullptr;
        sqlite3_open((directory / "tally.db").c_str(), &database);
        sqlite3_stmt* statement = nullptr;
        sqlite3_prepare_v2(database, sql.c_str(), -1, &statement, nullptr);
        std::int64_t result = sqlite3_step(statement) == SQLITE_ROW ? sqlite3_column_int64(statement, 0) : -1;
        sqlite3_finalize(statement);
        sqlite3_close(database);
        return result;
    }

    std::filesystem::path directory;
    CapturingLogSink log;
    ScopedInstall<MxLogSink> installLog{log};
};

TEST_F(SqliteStoreTest, UnwantedEventsAreNeverBuiltAndWantedOnesAreAllKept)
{
    std::ofstream(directory / "tally.json") << R"({"disabled": ["com.kestrel.harmonia.DriverStats", "exact.name"]})";
    std::string error;
    auto tally = SqliteTally::open(directory / "tally.db", directory / "tally.json", StoreLimit{}, error);
    ASSERT_TRUE(tally) << error;
    int built = 0;
    auto build = [&] {
        ++built;
        return Dictionary{{"k", "v"}, {"when", Date(std::chrono::seconds(0))}};
    };
    tally->sendEventLazy("com.kestrel.harmonia.DriverStats.Generic", build);
    tally->sendEventLazy("exact.name", build);
    // More than the bounded queue holds: the caller waits, nothing is dropped.
    const int events = SqliteStore::kQueueBound + 1000;
    for (int i = 0; i < events; ++i)
        tally->sendEventLazy("com.kestrel.harmonia.Playback.Start", build);
    tally->store().flush();
    EXPECT_EQ(built, events);
    EXPECT_EQ(count("SELECT count(*) FROM events"), events);
    EXPECT_EQ(count("SELECT count(*) FROM events WHERE payload = '{\"k\":\"v\",\"when\":\"1970-01-01T00:00:00Z\"}'"),
              events);
}

} // namespace
} // namespace mx::testing
