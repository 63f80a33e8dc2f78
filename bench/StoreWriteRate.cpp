// The analytics store's write rate against the ceiling of a bare SQLite batched
// insert on the same machine: same schema, same journal mode, same payload.
//
//   mxreporting_store_rate [--events N]

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <string>
#include <unistd.h>

#include <sqlite3.h>

#include "platform/MxLog.h"
#include "platform/linux/SqliteTally.h"
#include "platform/linux/StoreLimits.h"
#include "value/JsonValue.h"

using namespace mx;
using Clock = std::chrono::steady_clock;

namespace {

Dictionary payload(int i)
{
    return Dictionary{{"sample_rate", 48000},
                      {"route", "Speaker"},
                      {"buffer_frames", 512},
                      {"underruns", i % 3},
                      {"peak_level", -12.5},
                      {"codec", "aac"},
                      {"seq", i},
                      {"HostApplicationDisplayID", "com.example.player"}};
}

double bareInsert(const std::filesystem::path& file, int events)
{
    sqlite3* database = nullptr;
    sqlite3_open(file.c_str(), &database);
    sqlite3_exec(database,
                 "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL; "
                 "CREATE TABLE events(id INTEGER PRIMARY KEY, time REAL, name TEXT, payload TEXT)",
                 nullptr, nullptr, nullptr);
    sqlite3_stmt* insert = nullptr;
    sqlite3_prepare_v2(database, "INSERT INTO events(time, name, payload) VALUES(?, ?, ?)", -1, &insert, nullptr);
    auto began = Clock::now();
    for (int i = 0; i < events; i += int(SqliteStore::kBatchLimit)) {
        sqlite3_exec(database, "BEGIN", nullptr, nullptr, nullptr);
        for (int j = i; j < std::min(events, i + int(SqliteStore::kBatchLimit)); ++j) {
            // The payload is serialised here too: the store does the same work per row.
            std::string text = toJson(payload(j)).dump();
            sqlite3_bind_double(insert, 1, secondsSinceEpoch());
            sqlite3_bind_text(insert, 2, "com.kestrel.harmonia.Session_Playback.Start", -1, SQLITE_STATIC);
            sqlite3_bind_text(insert, 3, text.c_str(), -1, SQLITE_TRANSIENT);
            sqlite3_step(insert);
            sqlite3_reset(insert);
        }
        sqlite3_exec(database, "COMMIT", nullptr, nullptr, nullptr);
    }
    double seconds = std::chrono::duration<double>(Clock::now() - began).count();
    sqlite3_finalize(insert);
    sqlite3_close(database);
    return events / seconds;
}

double storeInsert(const std::filesystem::path& directory, int events)
{
    auto tally = SqliteTally::open(directory / "tally.db", {}, StoreLimit{});
    auto began = Clock::now();
    for (int i = 0; i < events; ++i)
        tally->sendEventLazy("com.kestrel.harmonia.Session_Playback.Start", [i] { return payload(i); });
    tally->store().flush();
    return events / std::chrono::duration<double>(Clock::now() - began).count();
}

int run(int argc, char** argv)
{
    int events = 500000;
    if (argc == 3 && std::string(argv[1]) == "--events")
        events = std::stoi(argv[2]);
    std::string pattern = (std::filesystem::temp_directory_path() / "mxreporting-store-rate-XXXXXX").string();
    std::filesystem::path directory = mkdtemp(pattern.data());
    double bare = bareInsert(directory / "bare.db", events);
    double store = storeInsert(directory, events);
    std::printf("%d analytics events of 8 keys\n", events);
    std::printf("bare SQLite batched insert  %10.0f rows/s\n", bare);
    std::printf("tally store (writer thread) %10.0f rows/s   ratio %.2f\n", store, store / bare);
    std::filesystem::remove_all(directory);
    return 0;
}

} // namespace

int main(int argc, char** argv)
{
    try {
        return run(argc, argv);
    } catch (const std::exception& error) {
        std::fprintf(stderr, "mxreporting_store_rate: %s\n", error.what());
        return 1;
    }
}
