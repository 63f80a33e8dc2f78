#include "platform/linux/JsonDeviceProperties.h"
#include "platform/linux/SpoolUplink.h"
#include "platform/linux/SqlitePendingRows.h"
#include "platform/linux/SqliteStore.h"
#include "platform/linux/SqliteTally.h"
#include "platform/linux/StoreLimits.h"

#include <fstream>
#include <thread>

#include <fmt/format.h>
#include <gmock/gmock.h>
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
    std::vector<std::string> errors;
    auto disabled = SqliteTally::readDisabled(directory / "tally.json", errors);
    ASSERT_TRUE(disabled);
    auto tally = SqliteTally::open(directory / "tally.db", *disabled, StoreLimit{});
    std::atomic<int> built = 0; // built where the row is kept, or on the writer
    auto build = [&] {
        ++built;
        return Dictionary{{"k", "v"}, {"when", Date(std::chrono::seconds(0))}};
    };
    tally->sendEventLazy("com.kestrel.harmonia.DriverStats.Generic", build);
    tally->sendEventLazy("exact.name", build);
    // Each row is owed by the client whose request made it, until the writer takes it.
    auto account = std::make_shared<BacklogAccount>(std::size_t{1} << 20);
    const int events = 70000;
    {
        ScopedBacklogAccount charging(account, 100);
        for (int i = 0; i < events; ++i)
            tally->sendEventLazy("com.kestrel.harmonia.Playback.Start", build);
    }
    tally->store().flush();
    EXPECT_EQ(account->owed(), 0u);
    EXPECT_EQ(built, events);
    EXPECT_EQ(count("SELECT count(*) FROM events"), events);
    EXPECT_EQ(count("SELECT count(*) FROM events WHERE payload = '{\"k\":\"v\",\"when\":\"1970-01-01T00:00:00Z\"}'"),
              events);
}

// Every store shares one writer thread: a store that cannot write must not hold up the
// others, and once it can, it writes what it held. The first batch also prunes by age.
TEST_F(SqliteStoreTest, AStoreThatCannotWriteHoldsUpNoOtherAndCatchesUp)
{
    const std::vector<std::string> schema = {"CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL)"};
    const std::vector<std::string> insert = {"INSERT INTO events(time) VALUES (?1)"};
    auto row = [](double time) {
        return SqliteWrite{0, {time}};
    };
    auto failing = SqliteStore::open(directory / "joule.db", schema, insert, {});
    auto healthy =
        SqliteStore::open(directory / "tally.db", schema, insert, eventsRetention({0, std::chrono::hours(24)}));

    // Its file gives way to a directory: the store cannot make a new one there.
    for (const char* suffix : {"", "-wal", "-shm"})
        std::filesystem::remove(directory / ("joule.db" + std::string(suffix)));
    std::filesystem::create_directory(directory / "joule.db");
    failing->submit(row(secondsSinceEpoch()));
    healthy->submit(row(1000.0)); // long past its age
    healthy->submit(row(secondsSinceEpoch()));
    healthy->flush();
    EXPECT_EQ(count("SELECT count(*) FROM events"), 1);
    EXPECT_EQ(count("SELECT count(*) FROM events WHERE time < 2000"), 0);

    auto logged = [&](const std::string& text) {
        return std::ranges::any_of(log.texts(), [&](const auto& line) { return line.find(text) != line.npos; });
    };
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!logged("joule.db: cannot write") && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    auto written = [&] {
        return *failing->status().find("rows_written")->asUInt();
    };
    EXPECT_EQ(written(), 0u);
    std::filesystem::remove(directory / "joule.db");
    failing->flush();
    EXPECT_EQ(written(), 1u);
    EXPECT_TRUE(logged("joule.db: writing again after"));
}

TEST_F(SqliteStoreTest, ConfigurationFilesAreReadStrictlyWithEveryErrorsPlace)
{
    auto write = [&](const char* name, const char* text) {
        std::ofstream(directory / name) << text;
        return directory / name;
    };
    std::vector<std::string> errors;
    write("ca.pem", "not a certificate");
    EXPECT_FALSE(SpoolUplink::readBackends(
        write("uplink.json",
              "{\"backends\": [\n  {\"type\": \"spool\"},\n"
              "  {\"type\": \"otlp-http\", \"url\": \"not a url\", \"compression\": \"zip\"},\n"
              "  {\"type\": \"otlp-http\", \"urll\": 1},\n"
              "  {\"type\": \"otlp-http\", \"url\": \"https://c:4318\", \"headers\": {\"Key\": 7},\n"
              "   \"tls\": {\"ca_file\": \"ca.pem\", \"cert_file\": \"none.pem\"}}]}"),
        errors));
    EXPECT_FALSE(StoreLimits::read(
        write("stores.json", "{\"tally\": {\"max_bytes\": 1},\n \"joule\": {\"max_bytes\": \"big\"}, \"tallly\": {}}"),
        errors));
    EXPECT_FALSE(SqliteTally::readDisabled(write("tally.json", "{\"disabled\": [\"a\",]}"), errors));
    EXPECT_FALSE(JsonDeviceProperties::check(write("device.json", "{\"InternalBuild\": \"yes\"}"), errors));
    auto in = [&](const std::string& file) {
        return (directory / file).string();
    };
    EXPECT_THAT(
        errors,
        ::testing::ElementsAre(
            in("uplink.json") + ":3:32: backends[1].url: \"not a url\" is no http or https URL with a host",
            in("uplink.json") + ":3:60: backends[1].compression must be \"gzip\" or \"none\"",
            in("uplink.json") +
                ":4:25: backends[2] has no setting \"urll\" (it has type, url, headers, tls, "
                "timeout_seconds, compression)",
            in("uplink.json") + ":4:3: backends[2] has no url: the collector's URL",
            in("uplink.json") + ":5:69: backends[3].headers.Key must be a string",
            in("uplink.json") + ":6:23: backends[3].tls.ca_file: " + in("ca.pem") + " holds no PEM certificate",
            in("uplink.json") + ":6:46: backends[3].tls.cert_file: " + in("none.pem") + " does not exist",
            in("stores.json") + ":2:33: stores.json has no setting \"tallly\" (it has tally, joule, uplink, summaries)",
            in("stores.json") + ":2:25: joule.max_bytes must be a number of at least 0",
            ::testing::StartsWith(in("tally.json") + ":1:19: syntax error"),
            in("device.json") + ":1:19: InternalBuild must be true or false"));

    errors.clear();
    std::filesystem::remove(directory / "uplink.json");
    auto backends = SpoolUplink::readBackends(directory / "uplink.json", errors);
    ASSERT_TRUE(backends) << "an absent file is the spool alone";
    EXPECT_TRUE(backends->spool);
    EXPECT_TRUE(errors.empty());
}

// The log is moved into the file once it passes its mark, with no further commit to set
// it off.
TEST_F(SqliteStoreTest, ALogPastItsMarkIsMovedIntoTheFileWithNoFurtherCommit)
{
    const std::uint64_t bound = 1 << 20;
    auto store = SqliteStore::open(directory / "tally.db",
                                   {"CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL)"},
                                   {"INSERT INTO events(time) VALUES (?1)"}, eventsRetention({bound, {}}));
    auto size = [&](const std::string& suffix) {
        return std::filesystem::file_size(directory / ("tally.db" + suffix));
    };
    const auto before = size("");
    // Half of the log's share (a quarter of the bound) beside its index, in pages.
    const std::uint64_t markPages = (bound / 4 - SqliteStore::kIndexBytes) / 2 / SqliteStore::kPageBytes;
    const std::uint64_t frameHeaderBytes = 24;
    while (size("-wal") < markPages * (SqliteStore::kPageBytes + frameHeaderBytes)) {
        store->submit({0, {secondsSinceEpoch()}});
        store->flush();
    }
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (size("") == before && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    EXPECT_GT(size(""), before);
}

// What a process that died leaves in its pending rows: the next open reads back, in
// order and across the ring's wrap, the rows its store had not committed, passes over
// those it had, and stops at a record damaged on the disk; numbering goes on after.
TEST_F(SqliteStoreTest, PendingRowsADeadProcessLeftAreReadBackInOrderUpToADamagedOne)
{
    const auto path = directory / "tally.db-pending";
    std::ofstream(path) << "not pending rows";
    std::filesystem::permissions(path, std::filesystem::perms(0640));
    std::string error;
    auto living = SqlitePendingRows::open(path, "tally.db", error);
    ASSERT_TRUE(living) << error;
    EXPECT_TRUE(living->rowsAfter(0, 1).empty());
    // About 300 bytes a row with 40 wanted at any time: the ring goes round several times.
    std::uint64_t released = 0;
    for (std::int64_t i = 1; i <= 3000; ++i) {
        SqliteWrite write{0, {i, fmt::format("row-{:06}", i) + std::string(250, '.'), Dictionary{{"i", i}}}};
        ASSERT_EQ(living->keep(SqlitePendingRows::encode(write)), static_cast<std::uint64_t>(i));
        if (i > 40)
            living->release(released = i - 40);
    }
    auto readBack = [&](std::uint64_t committed) {
        std::vector<std::int64_t> numbers;
        for (auto& row : SqlitePendingRows::open(path, "tally.db", error)->rowsAfter(committed, 1)) {
            EXPECT_EQ(std::get<std::string>(row.parameters[1]).substr(0, 10), fmt::format("row-{:06}", row.pending));
            EXPECT_EQ(std::get<Dictionary>(row.parameters[2]),
                      (Dictionary{{"i", std::get<std::int64_t>(row.parameters[0])}}));
            numbers.push_back(std::get<std::int64_t>(row.parameters[0]));
        }
        return numbers;
    };
    auto numbers = readBack(released);
    ASSERT_EQ(numbers.size(), 40u);
    EXPECT_EQ(numbers.front(), 2961);
    EXPECT_EQ(numbers.back(), 3000);
    // Committed, but the process died before it gave the rows back.
    EXPECT_EQ(readBack(2990).front(), 2991);

    std::ifstream file(path, std::ios::binary);
    std::string bytes((std::istreambuf_iterator<char>(file)), {});
    auto damaged = static_cast<std::streamoff>(bytes.find("row-002995") + 20);
    std::fstream(path, std::ios::in | std::ios::out | std::ios::binary).seekp(damaged).put('!');
    auto reopened = SqlitePendingRows::open(path, "tally.db", error);
    // From where the last start left off (2991) up to the damaged row.
    EXPECT_EQ(reopened->rowsAfter(released, 1).size(), 4u);
    SqliteWrite next{0, {std::int64_t{0}}};
    EXPECT_EQ(reopened->keep(SqlitePendingRows::encode(next)), 2995u);
    EXPECT_THAT(
        log.texts(),
        ::testing::Contains(::testing::HasSubstr("is not a file of tally.db's pending rows: starting it afresh")));
    EXPECT_THAT(log.texts(),
                ::testing::Contains(::testing::MatchesRegex(".*damaged at byte [0-9]+: read up to there; 5 "
                                                            "records lay past it, not read")));
}

// A file in the pending rows' place that is not the daemon's own to trust is set aside
// unread and a fresh one made: a link to another store's file, one others may write,
// anything but a regular file; and one another store wrote is not read as this one's.
TEST_F(SqliteStoreTest, PendingRowsOthersCouldHaveWrittenAreNeverReadBack)
{
    std::string error;
    auto keepOne = [&](const std::filesystem::path& path, const std::string& store) {
        auto rows = SqlitePendingRows::open(path, store, error);
        SqliteWrite write{0, {std::int64_t{7}}};
        rows->keep(SqlitePendingRows::encode(write));
    };
    auto readBack = [&](const std::filesystem::path& path, const std::string& store) {
        auto rows = SqlitePendingRows::open(path, store, error);
        return rows ? rows->rowsAfter(0, 1).size() : 99u;
    };
    keepOne(directory / "joule.db-pending", "joule.db");
    std::filesystem::create_hard_link(directory / "joule.db-pending", directory / "tally.db-pending");
    EXPECT_EQ(readBack(directory / "tally.db-pending", "tally.db"), 0u);
    EXPECT_EQ(readBack(directory / "joule.db-pending", "joule.db"), 1u) << "the original is its own store's";

    std::filesystem::copy_file(directory / "joule.db-pending", directory / "uplink.db-pending");
    std::filesystem::permissions(directory / "uplink.db-pending", std::filesystem::perms(0640));
    EXPECT_EQ(readBack(directory / "uplink.db-pending", "uplink.db"), 0u) << "another store's rows";

    keepOne(directory / "open.db-pending", "open.db");
    std::filesystem::permissions(directory / "open.db-pending", std::filesystem::perms(0666));
    EXPECT_EQ(readBack(directory / "open.db-pending", "open.db"), 0u) << "anyone could have written it";

    ASSERT_EQ(::mkfifo((directory / "fifo.db-pending").c_str(), 0600), 0);
    std::filesystem::create_directory(directory / "dir.db-pending");
    std::filesystem::create_symlink(directory / "joule.db-pending", directory / "link.db-pending");
    for (const char* name : {"fifo.db", "dir.db", "link.db"}) {
        EXPECT_EQ(readBack(directory / (std::string(name) + "-pending"), name), 0u) << name;
        EXPECT_TRUE(std::filesystem::is_regular_file(
            std::filesystem::symlink_status(directory / (std::string(name) + "-pending"))))
            << name << ": a fresh file in its place";
    }
    std::size_t setAside = 0;
    for (const auto& entry : std::filesystem::directory_iterator(directory))
        setAside += entry.path().filename().string().find(".set-aside-") != std::string::npos;
    EXPECT_EQ(setAside, 4u) << "the link's other name keeps its content";
}

// A row its store refuses (an id that is no integer) was kept pending by a daemon that
// died: the next open sets it aside with a line in the log and writes the others.
TEST_F(SqliteStoreTest, APendingRowTheStoreRefusesIsSetAsideAndKeepsNoStoreFromOpening)
{
    const std::vector<std::string> schema = {"CREATE TABLE IF NOT EXISTS events(id INTEGER PRIMARY KEY, time REAL)"};
    const std::vector<std::string> insert = {"INSERT INTO events(id, time) VALUES (?1, ?2)"};
    {
        std::string error;
        auto pending = SqlitePendingRows::open(directory / "tally.db-pending", "tally.db", error);
        ASSERT_TRUE(pending) << error;
        for (SqliteValue id :
             {SqliteValue(std::int64_t{1}), SqliteValue(std::string("not an id")), SqliteValue(std::int64_t{3})}) {
            SqliteWrite write{0, {id, 1.5}};
            pending->keep(SqlitePendingRows::encode(write));
        }
    }
    auto store = SqliteStore::open(directory / "tally.db", schema, insert, {});
    EXPECT_EQ(count("SELECT count(*) FROM events"), 2);
    EXPECT_THAT(log.texts(),
                ::testing::Contains(::testing::HasSubstr("a row it refuses (datatype mismatch) is set "
                                                         "aside: statement 0, [\"not an id\", 1.5]")));
    EXPECT_THAT(log.texts(), ::testing::Contains(::testing::HasSubstr("wrote the 2 answered rows kept in")));
    store->submit({0, {std::int64_t{4}, 2.5}});
    store->flush();
    EXPECT_EQ(count("SELECT count(*) FROM events"), 3) << "and it goes on";
}

} // namespace
} // namespace mx::testing
