#include "platform/linux/OtlpHttpExporter.h"

#include <algorithm>
#include <cmath>
#include <set>

#include <curl/curl.h>
#include <fmt/format.h>
#include <nlohmann/json.hpp>
#include <pthread.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <zlib.h>

#include "platform/MxLog.h"
#include "platform/WorkQueue.h"
#include "platform/linux/SqliteStore.h"

namespace mx {

namespace {

using Json = nlohmann::ordered_json;

constexpr std::size_t kBatchMessages = 512;
constexpr auto kIdlePoll = std::chrono::milliseconds(200);
constexpr auto kFirstBackoff = std::chrono::seconds(1);
constexpr auto kLongestBackoff = std::chrono::seconds(60);
constexpr auto kProbeReuse = std::chrono::seconds(5);
constexpr auto kProbeTimeout = std::chrono::seconds(3);
constexpr auto kConnectTimeout = std::chrono::seconds(3);

Json anyValue(const Json& value)
{
    if (value.is_string())
        return {{"stringValue", value.get<std::string>()}};
    if (value.is_boolean())
        return {{"boolValue", value.get<bool>()}};
    if (value.is_number_integer())
        return {{"intValue", std::to_string(value.get<std::int64_t>())}};
    if (value.is_number_unsigned())
        return {{"intValue", std::to_string(value.get<std::uint64_t>())}};
    if (value.is_number_float())
        return {{"doubleValue", value.get<double>()}};
    if (value.is_array()) {
        Json values = Json::array();
        for (const auto& item : value)
            values.push_back(anyValue(item));
        return {{"arrayValue", {{"values", values}}}};
    }
    if (value.is_object()) {
        Json values = Json::array();
        for (const auto& [key, item] : value.items())
            values.push_back({{"key", key}, {"value", anyValue(item)}});
        return {{"kvlistValue", {{"values", values}}}};
    }
    return Json::object();
}

Json attribute(const std::string& key, const Json& value) { return {{"key", key}, {"value", anyValue(value)}}; }

Json parsed(const unsigned char* text)
{
    if (!text)
        return nullptr;
    auto json = Json::parse(reinterpret_cast<const char*>(text), nullptr, false);
    return json.is_discarded() ? Json(nullptr) : json;
}

// One spooled message as an OTLP log record: the payload is the body, the rest
// (category, type, session and its information) are attributes.
Json logRecord(sqlite3_stmt* row)
{
    double time = sqlite3_column_double(row, 1);
    auto nanos = std::to_string(static_cast<std::int64_t>(std::llround(time * 1e9)));
    Json sessionInfo = parsed(sqlite3_column_text(row, 5));
    Json userInfo = parsed(sqlite3_column_text(row, 6));
    Json attributes = Json::array({attribute("harmonia.category", sqlite3_column_int64(row, 2)),
                                   attribute("harmonia.type", sqlite3_column_int64(row, 3))});
    if (sqlite3_column_type(row, 7) != SQLITE_NULL)
        attributes.push_back(attribute("harmonia.spool_session", sqlite3_column_int64(row, 7)));
    if (sessionInfo.is_object())
        for (const auto& [key, value] : sessionInfo.items())
            attributes.push_back(attribute("harmonia.session." + key, value));
    if (userInfo.is_object())
        for (const auto& [key, value] : userInfo.items())
            attributes.push_back(attribute("harmonia.user." + key, value));
    return {{"timeUnixNano", nanos},
            {"observedTimeUnixNano", nanos},
            {"severityNumber", 9},
            {"severityText", "INFO"},
            {"body", anyValue(parsed(sqlite3_column_text(row, 4)))},
            {"attributes", attributes}};
}

std::string logsRequest(const Json& records)
{
    Json request = {
        {"resourceLogs",
         Json::array({{{"resource", {{"attributes", Json::array({attribute("service.name", "mxreportingd")})}}},
                       {"scopeLogs",
                        Json::array({{{"scope", {{"name", "com.kestrel.harmonia"}}}, {"logRecords", records}}})}}})}};
    return request.dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::size_t discardBody(char*, std::size_t size, std::size_t count, void*) { return size * count; }

// The request body as gzip: OTLP batches are repetitive JSON and shrink several times.
std::string gzip(const std::string& text)
{
    z_stream stream{};
    constexpr int kGzipWindow = 15 + 16;
    if (deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, kGzipWindow, 8, Z_DEFAULT_STRATEGY) != Z_OK)
        return {};
    std::string out(deflateBound(&stream, text.size()), '\0');
    stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
    stream.avail_in = static_cast<uInt>(text.size());
    stream.next_out = reinterpret_cast<Bytef*>(out.data());
    stream.avail_out = static_cast<uInt>(out.size());
    deflate(&stream, Z_FINISH);
    out.resize(stream.total_out);
    deflateEnd(&stream);
    return out;
}

// One-shot messages and realtime sessions' messages, in spool order, past the cursor.
constexpr const char* kStreamQuery =
    "SELECT m.id, m.time, m.category, m.type, m.payload, coalesce(s.session_info, m.session_info), "
    "coalesce(s.user_info, m.user_info), m.session FROM messages m LEFT JOIN sessions s ON s.id = m.session "
    "WHERE m.id > ?1 AND (m.session IS NULL OR json_extract(s.session_info, '$.ContainsRealtimeEvents') = 1) "
    "ORDER BY m.id LIMIT ?2";
constexpr const char* kFlushedSessionsQuery =
    "SELECT s.id FROM sessions s WHERE s.flushed IS NOT NULL "
    "AND coalesce(json_extract(s.session_info, '$.ContainsRealtimeEvents'), 0) = 0 "
    "AND NOT EXISTS (SELECT 1 FROM exported_sessions e WHERE e.backend = ?1 AND e.session = s.id) "
    "ORDER BY s.id LIMIT 16";
constexpr const char* kSessionMessagesQuery =
    "SELECT m.id, m.time, m.category, m.type, m.payload, s.session_info, s.user_info, m.session "
    "FROM messages m JOIN sessions s ON s.id = m.session WHERE m.session = ?1 AND m.id > ?2 ORDER BY m.id LIMIT ?3";

// What is due for export and not acknowledged: one-shot and realtime messages past
// the cursor, and the messages of flushed batch sessions not yet exported.
constexpr const char* kStreamLagQuery =
    "SELECT count(*), min(m.time) FROM messages m LEFT JOIN sessions s ON s.id = m.session "
    "WHERE m.id > coalesce((SELECT stream_cursor FROM exports WHERE backend = ?1), 0) "
    "AND (m.session IS NULL OR json_extract(s.session_info, '$.ContainsRealtimeEvents') = 1)";
constexpr const char* kSessionLagQuery =
    "SELECT count(*), min(m.time) FROM sessions s JOIN messages m ON m.session = s.id "
    "WHERE s.flushed IS NOT NULL AND coalesce(json_extract(s.session_info, '$.ContainsRealtimeEvents'), 0) = 0 "
    "AND NOT EXISTS (SELECT 1 FROM exported_sessions e WHERE e.backend = ?1 AND e.session = s.id)";
constexpr std::chrono::seconds kLagInterval{2};

} // namespace

OtlpHttpExporter::OtlpHttpExporter(std::filesystem::path spool, OtlpCollector collector)
    : spool_(std::move(spool)), collector_(std::move(collector))
{
    thread_ = std::thread([this] {
        pthread_setname_np(pthread_self(), "mx-otlp");
        run();
    });
}

OtlpHttpExporter::~OtlpHttpExporter()
{
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    changed_.notify_all();
    thread_.join();
}

void OtlpHttpExporter::wake()
{
    {
        std::lock_guard lock(mutex_);
        woken_ = true;
    }
    changed_.notify_all();
}

std::optional<UplinkError> OtlpHttpExporter::currentError() const
{
    std::lock_guard lock(mutex_);
    return error_;
}

std::optional<bool> OtlpHttpExporter::answeredLately() const
{
    std::lock_guard lock(mutex_);
    auto now = std::chrono::steady_clock::now();
    if (lastAnswered_ && now - *lastAnswered_ < kProbeReuse)
        return true;
    if (lastAsked_ && now - *lastAsked_ < kProbeReuse)
        return false;
    return std::nullopt;
}

// Every session start asks: the collector is asked at most once a few seconds, and
// however many starts ask at once, one probe answers them all, holding one thread.
void OtlpHttpExporter::probe(UniqueFunction<void(bool)> answered)
{
    if (auto known = answeredLately()) {
        answered(*known);
        return;
    }
    {
        std::lock_guard lock(mutex_);
        probeWaiters_.push_back(std::move(answered));
        if (std::exchange(probing_, true))
            return;
    }
    ProcessWide<Dispatch>::get().globalQueue(QueuePriority::Utility).dispatch([self = shared_from_this()] {
        ScopedBlockingCall probing;
        std::chrono::seconds retryAfter{0};
        long status = 0;
        // A handle of its own: the exporter thread's may be in the middle of a request.
        CURL* curl = curl_easy_init();
        self->post(curl, logsRequest(Json::array()),
                   std::min<std::chrono::milliseconds>(self->collector_.timeout, kProbeTimeout), retryAfter, status);
        curl_easy_cleanup(curl);
        std::vector<UniqueFunction<void(bool)>> waiters;
        {
            std::lock_guard lock(self->mutex_);
            self->noteAsked(status);
            self->probing_ = false;
            waiters.swap(self->probeWaiters_);
        }
        for (auto& waiter : waiters)
            waiter(status != 0);
    });
}

void OtlpHttpExporter::noteAsked(long status)
{
    auto now = std::chrono::steady_clock::now();
    lastAsked_ = now;
    if (status != 0)
        lastAnswered_ = now;
}

std::optional<UplinkError> OtlpHttpExporter::post(CURL* curl, const std::string& body,
                                                  std::chrono::milliseconds timeout, std::chrono::seconds& retryAfter,
                                                  long& status)
{
    status = 0;
    if (!curl)
        return UplinkError{-1, "cannot create an HTTP request"};
    std::string compressed = collector_.gzip ? gzip(body) : std::string();
    const std::string& sent = collector_.gzip ? compressed : body;
    char failure[CURL_ERROR_SIZE] = "";
    curl_easy_setopt(curl, CURLOPT_URL, collector_.url.c_str());
    curl_easy_setopt(curl, CURLOPT_POSTFIELDS, sent.data());
    curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(sent.size()));
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT_MS,
                     static_cast<long>(std::min<std::chrono::milliseconds>(timeout, kConnectTimeout).count()));
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, static_cast<long>(timeout.count()));
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_ACCEPT_ENCODING, "");
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, failure);
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, discardBody);
    // What the files held when the configuration was read, never the files again: what
    // is in their place now may block, or be something else. Nothing given leaves
    // curl's own choice: the system's CAs, no client certificate.
    auto pemOption = [&](CURLoption option, const OtlpCollector::Pem& pem) {
        if (pem.contents.empty())
            return;
        curl_blob blob{const_cast<char*>(pem.contents.data()), pem.contents.size(), CURL_BLOB_COPY};
        curl_easy_setopt(curl, option, &blob);
    };
    pemOption(CURLOPT_CAINFO_BLOB, collector_.ca);
    pemOption(CURLOPT_SSLCERT_BLOB, collector_.cert);
    pemOption(CURLOPT_SSLKEY_BLOB, collector_.key);
    if (!collector_.cert.contents.empty()) {
        curl_easy_setopt(curl, CURLOPT_SSLCERTTYPE, "PEM");
        curl_easy_setopt(curl, CURLOPT_SSLKEYTYPE, "PEM");
    }
    curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
    if (collector_.gzip)
        headers = curl_slist_append(headers, "Content-Encoding: gzip");
    for (const auto& [name, value] : collector_.headers)
        headers = curl_slist_append(headers, fmt::format("{}: {}", name, value).c_str());
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers);
    CURLcode result = curl_easy_perform(curl);
    curl_off_t retry = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    curl_easy_getinfo(curl, CURLINFO_RETRY_AFTER, &retry);
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, nullptr);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, nullptr);
    curl_slist_free_all(headers);
    retryAfter = std::chrono::seconds(retry);
    if (result != CURLE_OK) {
        const char* hint = result == CURLE_PEER_FAILED_VERIFICATION
            ? " (the CA to trust is tls.ca_file of this collector in uplink.json)"
            : "";
        return UplinkError{
            result, fmt::format("{}: {}{}", collector_.url, failure[0] ? failure : curl_easy_strerror(result), hint)};
    }
    if (status < 200 || status >= 300)
        return UplinkError{status, fmt::format("{}: HTTP status {}", collector_.url, status)};
    return std::nullopt;
}

bool OtlpHttpExporter::openSpool()
{
    struct stat file {};
    bool present = ::stat(spool_.c_str(), &file) == 0;
    if (database_ && present && file.st_dev == spoolDevice_ && file.st_ino == spoolInode_)
        return true;
    if (database_) {
        // The store set the file aside or made it anew: the rows to export are there now.
        MXLOG_LIMITED(nullptr, Default, "otlp exporter to {}: {} was made anew, reading the new one", collector_.url,
                      spool_.string());
        sqlite3_close(database_);
        database_ = nullptr;
    }
    // The spool makes the file and the exports tables; until it has, there is nothing to read.
    if (!present || sqlite3_open_v2(spool_.c_str(), &database_, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
        sqlite3_close(database_);
        database_ = nullptr;
        return false;
    }
    sqlite3_busy_timeout(database_, 5000);
    spoolDevice_ = file.st_dev;
    spoolInode_ = file.st_ino;
    return true;
}

void OtlpHttpExporter::run()
{
    // One handle for the thread's life keeps the collector's connection open.
    handle_ = curl_easy_init();

    auto backoff = kFirstBackoff;
    for (;;) {
        std::size_t exported = 0;
        auto failure = openSpool() ? exportBatch(exported)
                                   : std::optional<UplinkError>(UplinkError{-1, spool_.string() + " cannot be read"});
        std::chrono::milliseconds pause = kIdlePoll;
        {
            std::lock_guard lock(mutex_);
            bool wasFailing = error_.has_value();
            error_ = failure;
            ++passes_;
            if (failure && !wasFailing)
                MXLOG_LIMITED(nullptr, Error, "otlp export failing, keeping messages in the spool: {}",
                              failure->description);
            if (!failure && wasFailing)
                MXLOG_LIMITED(nullptr, Default, "otlp export to {} recovered", collector_.url);
        }
        changed_.notify_all();
        measureLag();
        if (failure) {
            // The collector's own word on when to come back wins over our backoff.
            pause = std::max<std::chrono::milliseconds>(backoff, retryAfter_);
            retryAfter_ = std::chrono::seconds(0);
            backoff = std::min(backoff * 2, kLongestBackoff);
        } else {
            backoff = kFirstBackoff;
            if (exported > 0)
                pause = std::chrono::milliseconds(0);
        }
        std::unique_lock lock(mutex_);
        changed_.wait_for(lock, pause, [&] { return stopping_ || woken_; });
        woken_ = false;
        if (stopping_)
            break;
    }
    curl_easy_cleanup(handle_);
    sqlite3_close(database_);
}

void OtlpHttpExporter::measureLag()
{
    auto now = std::chrono::steady_clock::now();
    if (!database_ || now - lagMeasured_ < kLagInterval)
        return;
    lagMeasured_ = now;
    std::int64_t count = 0;
    double oldest = 0;
    for (const char* sql : {kStreamLagQuery, kSessionLagQuery}) {
        sqlite3_stmt* statement = nullptr;
        if (sqlite3_prepare_v2(database_, sql, -1, &statement, nullptr) != SQLITE_OK)
            return;
        sqlite3_bind_text(statement, 1, collector_.url.c_str(), -1, SQLITE_TRANSIENT);
        if (sqlite3_step(statement) == SQLITE_ROW && sqlite3_column_int64(statement, 0) > 0) {
            count += sqlite3_column_int64(statement, 0);
            double first = sqlite3_column_double(statement, 1);
            oldest = oldest == 0 ? first : std::min(oldest, first);
        }
        sqlite3_finalize(statement);
    }
    std::lock_guard lock(mutex_);
    unacknowledged_ = count;
    oldestUnacknowledged_ = oldest;
}

Dictionary OtlpHttpExporter::status() const
{
    std::lock_guard lock(mutex_);
    double age = oldestUnacknowledged_ == 0 ? 0 : std::max(0.0, secondsSinceEpoch() - oldestUnacknowledged_);
    return Dictionary{{"unacknowledged", unacknowledged_},
                      {"oldest_seconds", age},
                      {"last_error", error_ ? error_->description : std::string()}};
}

std::optional<UplinkError> OtlpHttpExporter::exportBatch(std::size_t& exported)
{
    auto query = [&](const char* sql, auto bind, auto each) {
        sqlite3_stmt* statement = nullptr;
        if (sqlite3_prepare_v2(database_, sql, -1, &statement, nullptr) != SQLITE_OK)
            return false;
        bind(statement);
        while (sqlite3_step(statement) == SQLITE_ROW)
            each(statement);
        sqlite3_finalize(statement);
        return true;
    };
    auto record = [&](const char* sql, std::int64_t number) {
        query(
            sql,
            [&](sqlite3_stmt* s) {
                sqlite3_bind_text(s, 1, collector_.url.c_str(), -1, SQLITE_TRANSIENT);
                sqlite3_bind_int64(s, 2, number);
            },
            [](sqlite3_stmt*) {});
    };
    auto send = [&](const Json& records, std::optional<UplinkError>& failure) {
        std::chrono::seconds retryAfter{0};
        long status = 0;
        failure = post(handle_, logsRequest(records), collector_.timeout, retryAfter, status);
        {
            std::lock_guard lock(mutex_);
            noteAsked(status);
        }
        if (failure && retryAfter.count() > 0) {
            failure->description += fmt::format(" (retry after {} s)", retryAfter.count());
            retryAfter_ = retryAfter;
        }
        // A collector that refuses the content itself will refuse it again: it is
        // logged and passed over rather than retried for ever.
        if (failure && failure->code >= 400 && failure->code < 500 && failure->code != 408 && failure->code != 429) {
            MXLOG_LIMITED(nullptr, Error, "otlp collector rejected {} records, not retrying: {}", records.size(),
                          failure->description);
            failure.reset();
        }
        return !failure;
    };

    std::int64_t cursor = 0;
    query(
        "SELECT stream_cursor FROM exports WHERE backend = ?1",
        [&](sqlite3_stmt* s) { sqlite3_bind_text(s, 1, collector_.url.c_str(), -1, SQLITE_TRANSIENT); },
        [&](sqlite3_stmt* s) { cursor = sqlite3_column_int64(s, 0); });

    Json records = Json::array();
    std::int64_t last = cursor;
    query(
        kStreamQuery,
        [&](sqlite3_stmt* s) {
            sqlite3_bind_int64(s, 1, cursor);
            sqlite3_bind_int64(s, 2, kBatchMessages);
        },
        [&](sqlite3_stmt* s) {
            records.push_back(logRecord(s));
            last = sqlite3_column_int64(s, 0);
        });
    std::optional<UplinkError> failure;
    if (!records.empty()) {
        if (!send(records, failure))
            return failure;
        record("INSERT INTO exports(backend, stream_cursor) VALUES(?1, ?2) "
               "ON CONFLICT(backend) DO UPDATE SET stream_cursor = ?2",
               last);
        exported += records.size();
    }

    std::vector<std::int64_t> sessions;
    query(
        kFlushedSessionsQuery,
        [&](sqlite3_stmt* s) { sqlite3_bind_text(s, 1, collector_.url.c_str(), -1, SQLITE_TRANSIENT); },
        [&](sqlite3_stmt* s) { sessions.push_back(sqlite3_column_int64(s, 0)); });
    for (auto session : sessions) {
        std::int64_t after = 0;
        for (;;) {
            Json chunk = Json::array();
            query(
                kSessionMessagesQuery,
                [&](sqlite3_stmt* s) {
                    sqlite3_bind_int64(s, 1, session);
                    sqlite3_bind_int64(s, 2, after);
                    sqlite3_bind_int64(s, 3, kBatchMessages);
                },
                [&](sqlite3_stmt* s) {
                    chunk.push_back(logRecord(s));
                    after = sqlite3_column_int64(s, 0);
                });
            if (chunk.empty())
                break;
            if (!send(chunk, failure))
                return failure;
            exported += chunk.size();
        }
        record("INSERT OR IGNORE INTO exported_sessions(backend, session) VALUES(?1, ?2)", session);
        std::lock_guard lock(mutex_);
        deliveredSessions_.insert(session);
    }
    return std::nullopt;
}

std::optional<UplinkError> OtlpHttpExporter::waitForSession(std::int64_t session, std::chrono::milliseconds timeout)
{
    wake();
    std::unique_lock lock(mutex_);
    std::uint64_t startedAt = passes_;
    bool settled = changed_.wait_for(lock, timeout, [&] {
        return deliveredSessions_.count(session) > 0 || (error_ && passes_ > startedAt) || stopping_;
    });
    if (deliveredSessions_.erase(session) > 0)
        return std::nullopt;
    if (settled && error_)
        return error_;
    return UplinkError{-1, fmt::format("{}: session not acknowledged in time, kept in the spool", collector_.url)};
}

} // namespace mx
