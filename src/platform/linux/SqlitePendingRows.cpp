#include "platform/linux/SqlitePendingRows.h"

#include <algorithm>
#include <atomic>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <system_error>
#include <unistd.h>

#include <fmt/format.h>
#include <msgpack.hpp>
#include <zlib.h>

#include "platform/MxLog.h"
#include "platform/linux/SqliteStore.h"
#include "wire/MsgpackValue.h"

namespace mx {

namespace {

// The header: a signature, the offset of the oldest record still wanted, and the name of
// the store the rows are for (zeros in a file made before files named their store).
constexpr char kSignature[16] = {'m', 'x', 'r', 'e', 'p', 'o', 'r', 't', 'i', 'n', 'g', '-', 'r', 'o', 'w', 's'};
constexpr std::uint64_t kTailOffset = 16;
constexpr std::uint64_t kStoreNameOffset = 24;
constexpr std::size_t kStoreNameBytes = 40;
constexpr std::uint64_t kHeaderBytes = 64;
// A record numbered past this was not numbered by a store: one more would wrap.
constexpr std::uint64_t kLargestNumber = std::uint64_t{1} << 62;

// A record: magic, payload length, number, checksum (of the length, the number and
// the payload), a zero word, then the payload, padded to eight bytes.
constexpr std::uint32_t kRecordMagic = 0x574f5258; // "XROW"
constexpr std::uint32_t kWrapMagic = 0x50415257;   // "WRAP": the next record is at the front
constexpr std::uint64_t kRecordHeaderBytes = 24;
constexpr std::uint64_t kTerminatorRoom = 8; // the zero word after the newest record, padded

// The rows are the service's own, but their reports come from clients: decoding
// allows what the wire allows, with room for the service's own wrapping.
constexpr std::size_t kMaximumDepth = 2 * kMsgpackMaximumDepth;

std::uint64_t recordBytes(std::size_t payload) { return (kRecordHeaderBytes + payload + 7) & ~std::uint64_t{7}; }

// Against a record half written back when the machine went down. Adler-32 rather
// than a CRC: it needs no tables, which a row on cold caches would first fetch.
std::uint32_t checksum(const char* record, std::size_t payload)
{
    auto bytes = [](const char* from) {
        return reinterpret_cast<const Bytef*>(from);
    };
    uLong sum = adler32_z(adler32_z(0, nullptr, 0), bytes(record + 4), 12);
    return static_cast<std::uint32_t>(adler32_z(sum, bytes(record + kRecordHeaderBytes), payload));
}

template <typename T>
T load(const char* at)
{
    T value;
    std::memcpy(&value, at, sizeof value);
    return value;
}

template <typename T>
void store(char* at, T value)
{
    std::memcpy(at, &value, sizeof value);
}

// Written last, so that what it stands for is whole before it can be read.
void publishMagic(char* at, std::uint32_t magic)
{
    std::atomic_ref(*reinterpret_cast<std::uint32_t*>(at)).store(magic, std::memory_order_release);
}

std::string errnoText(int error) { return std::generic_category().message(error); }

// Zeros written rather than a hole: a full disk shows now, not as a fault on a page
// of the mapping later.
bool makeAfresh(int fd, const std::string& storeName, std::string& error)
{
    std::vector<char> zeros(std::size_t{64} << 10);
    bool written = ::ftruncate(fd, 0) == 0;
    for (std::size_t at = 0; written && at < SqlitePendingRows::kFileBytes; at += zeros.size()) {
        ssize_t count = ::pwrite(fd, zeros.data(), zeros.size(), static_cast<off_t>(at));
        written = count == static_cast<ssize_t>(zeros.size());
        if (count >= 0 && !written)
            errno = ENOSPC;
    }
    char name[kStoreNameBytes] = {};
    storeName.copy(name, kStoreNameBytes - 1);
    if (written)
        written = ::pwrite(fd, kSignature, sizeof kSignature, 0) == sizeof kSignature &&
            ::pwrite(fd, &kHeaderBytes, sizeof kHeaderBytes, kTailOffset) == sizeof kHeaderBytes &&
            ::pwrite(fd, name, sizeof name, kStoreNameOffset) == sizeof name;
    if (!written)
        error = "cannot make it: " + errnoText(errno);
    return written;
}

// A file of this store's pending rows: one of another store's would put its rows in
// the wrong table.
bool looksKept(const char* base, const std::string& storeName)
{
    auto tail = load<std::uint64_t>(base + kTailOffset);
    std::string_view named(base + kStoreNameOffset, ::strnlen(base + kStoreNameOffset, kStoreNameBytes));
    return std::memcmp(base, kSignature, sizeof kSignature) == 0 && tail >= kHeaderBytes &&
        tail + kTerminatorRoom <= SqlitePendingRows::kFileBytes && tail % 8 == 0 &&
        (named.empty() || named == storeName);
}

// A parameter goes through the wire's own decoder; a row holds only the kinds a
// parameter can be.
std::optional<SqliteValue> decodeParameter(const msgpack::object& object)
{
    std::string reason;
    auto value = decodeMsgpack(object, reason, kMaximumDepth);
    if (!value)
        return std::nullopt;
    if (value->isNil())
        return SqliteValue(nullptr);
    if (const auto* integer = value->asInt())
        return SqliteValue(*integer);
    if (const auto* real = value->asDouble())
        return SqliteValue(*real);
    if (const auto* text = value->asString())
        return SqliteValue(*text);
    if (const auto* dictionary = value->asDictionary())
        return SqliteValue(*dictionary);
    return std::nullopt;
}

std::optional<SqliteWrite> decodeRow(std::string_view bytes, std::size_t statements)
{
    msgpack::object_handle handle;
    try {
        handle = msgpack::unpack(bytes.data(), bytes.size());
    } catch (const std::exception&) {
        return std::nullopt;
    }
    const msgpack::object& row = handle.get();
    if (row.type != msgpack::type::ARRAY || row.via.array.size == 0 ||
        row.via.array.ptr[0].type != msgpack::type::POSITIVE_INTEGER || row.via.array.ptr[0].via.u64 >= statements)
        return std::nullopt;
    SqliteWrite write{static_cast<std::size_t>(row.via.array.ptr[0].via.u64), {}};
    write.parameters.reserve(row.via.array.size - 1);
    for (std::uint32_t i = 1; i < row.via.array.size; ++i) {
        auto parameter = decodeParameter(row.via.array.ptr[i]);
        if (!parameter)
            return std::nullopt;
        write.parameters.push_back(std::move(*parameter));
    }
    return write;
}

} // namespace

namespace {

// Why a file in the pending rows' place is not this daemon's own to trust: rows that
// others can write, or that another path also names, would be written into the store
// as if they had been answered here. Nothing when it is.
std::optional<std::string> untrusted(const struct stat& file)
{
    if (!S_ISREG(file.st_mode))
        return "it is not a regular file";
    if (file.st_nlink != 1)
        return fmt::format("it has {} links", file.st_nlink);
    if (file.st_uid != ::geteuid())
        return fmt::format("it is owned by uid {}, not this daemon's {}", file.st_uid, ::geteuid());
    mode_t mode = file.st_mode & 07777;
    if (mode != 0600 && mode != SqliteStore::kFileMode)
        return fmt::format("its mode is {:04o}, not 0600 or {:04o}", mode, SqliteStore::kFileMode);
    return std::nullopt;
}

// "tally.db-pending" -> "tally.db-pending.set-aside-20261123T041500".
void setAside(const std::filesystem::path& path, const std::string& why)
{
    std::time_t now = std::time(nullptr);
    std::tm local{};
    localtime_r(&now, &local);
    char stamp[32];
    std::strftime(stamp, sizeof(stamp), "%Y%m%dT%H%M%S", &local);
    auto aside = path.string() + ".set-aside-" + stamp;
    std::error_code failure;
    std::filesystem::rename(path, aside, failure);
    if (failure)
        std::filesystem::remove_all(path, failure);
    MXLOG_LIMITED(nullptr, Error, "{}: {}: set aside as {} unread, starting a fresh one", path.string(), why,
                  failure ? std::string("nothing (it could not be moved either)")
                          : std::filesystem::path(aside).filename().string());
}

// The file opened for reading and writing, nothing on the other end able to block the
// open; a file that is not the daemon's own is set aside and a fresh one made.
int openOwnFile(const std::filesystem::path& path, std::string& error)
{
    constexpr int kFlags = O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
    int fd = ::open(path.c_str(), kFlags | O_CREAT, SqliteStore::kFileMode);
    if (fd < 0 && (errno == ELOOP || errno == EISDIR || errno == ENXIO)) {
        setAside(path, errno == ELOOP ? "it is a symbolic link" : "it is not a regular file");
        fd = ::open(path.c_str(), kFlags | O_CREAT | O_EXCL, SqliteStore::kFileMode);
    }
    if (fd < 0) {
        error = "cannot open it: " + errnoText(errno);
        return -1;
    }
    struct stat file {};
    if (::fstat(fd, &file) != 0) {
        error = "cannot look at it: " + errnoText(errno);
        ::close(fd);
        return -1;
    }
    if (auto why = untrusted(file)) {
        ::close(fd);
        // A link's content stays under its other names: this one goes, and they are
        // their own files again.
        if (S_ISREG(file.st_mode) && file.st_nlink > 1 && ::unlink(path.c_str()) == 0)
            MXLOG_LIMITED(nullptr, Error, "{}: {}: this name of it removed unread, starting a fresh one", path.string(),
                          *why);
        else
            setAside(path, *why);
        fd = ::open(path.c_str(), kFlags | O_CREAT | O_EXCL, SqliteStore::kFileMode);
        if (fd < 0)
            error = "cannot make it: " + errnoText(errno);
    }
    return fd;
}

} // namespace

std::unique_ptr<SqlitePendingRows> SqlitePendingRows::open(const std::filesystem::path& path,
                                                           const std::string& storeName, std::string& error)
{
    int fd = openOwnFile(path, error);
    if (fd < 0)
        return nullptr;
    struct stat status {};
    // Its pages all on disk: one missing would be a fault on the mapping when a full
    // disk cannot give it, and the daemon would die of it.
    bool sized = ::fstat(fd, &status) == 0 && static_cast<std::uint64_t>(status.st_size) == kFileBytes &&
        (static_cast<std::uint64_t>(status.st_blocks) * 512 >= kFileBytes ||
         ::posix_fallocate(fd, 0, static_cast<off_t>(kFileBytes)) == 0);
    void* mapping = sized ? ::mmap(nullptr, kFileBytes, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0) : MAP_FAILED;
    bool foreign =
        sized ? mapping != MAP_FAILED && !looksKept(static_cast<const char*>(mapping), storeName) : status.st_size > 0;
    if (foreign) {
        MXLOG_LIMITED(nullptr, Error, "{} is not a file of {}'s pending rows: starting it afresh", path.string(),
                      storeName);
        if (mapping != MAP_FAILED)
            ::munmap(mapping, kFileBytes);
        mapping = MAP_FAILED;
    }
    if ((!sized || foreign) && makeAfresh(fd, storeName, error)) {
        ::fchmod(fd, SqliteStore::kFileMode);
        mapping = ::mmap(nullptr, kFileBytes, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    }
    int mapError = errno;
    ::close(fd);
    if (mapping == MAP_FAILED) {
        if (error.empty())
            error = "cannot map it: " + errnoText(mapError);
        return nullptr;
    }
    return std::unique_ptr<SqlitePendingRows>(new SqlitePendingRows(path, static_cast<char*>(mapping)));
}

SqlitePendingRows::SqlitePendingRows(std::filesystem::path path, char* base)
    : path_(std::move(path)), base_(base), head_(load<std::uint64_t>(base + kTailOffset))
{
}

SqlitePendingRows::~SqlitePendingRows() { ::munmap(base_, kFileBytes); }

std::vector<SqliteWrite> SqlitePendingRows::rowsAfter(std::uint64_t committed, std::size_t statements)
{
    std::vector<SqliteWrite> rows;
    std::uint64_t at = head_;
    std::uint64_t last = 0;
    // A walk longer than the file has gone round it.
    for (std::uint64_t walked = 0; at + kRecordHeaderBytes <= kFileBytes && walked <= kFileBytes;) {
        const char* record = base_ + at;
        auto magic = load<std::uint32_t>(record);
        if (magic == kWrapMagic && at != kHeaderBytes) {
            walked += kFileBytes - at;
            at = kHeaderBytes;
            continue;
        }
        if (magic == 0)
            break;
        auto length = load<std::uint32_t>(record + 4);
        auto number = load<std::uint64_t>(record + 8);
        auto size = recordBytes(length);
        if (magic != kRecordMagic || at + size + kTerminatorRoom > kFileBytes || (last != 0 && number != last + 1) ||
            number == 0 || number >= kLargestNumber || checksum(record, length) != load<std::uint32_t>(record + 16)) {
            MXLOG_LIMITED(nullptr, Error, "{}: damaged at byte {}: read up to there; {} records lay past it, not read",
                          path_.string(), at, recordsNewerThan(last));
            break;
        }
        last = number;
        walked += size;
        if (number > committed) {
            if (auto row = decodeRow({record + kRecordHeaderBytes, length}, statements)) {
                kept_.push_back({number, at});
                row->pending = number;
                rows.push_back(std::move(*row));
            } else {
                MXLOG_LIMITED(nullptr, Error, "{}: row {} cannot be read back: left out", path_.string(), number);
            }
        }
        at += size;
    }
    // Whatever follows the last whole record (one cut short, or older ones) is cut off.
    head_ = at;
    if (head_ + sizeof(std::uint32_t) <= kFileBytes)
        store<std::uint32_t>(base_ + head_, 0);
    next_ = std::max(last, committed) + 1;
    publishTail();
    updateRoom();
    return rows;
}

// Whole records anywhere in the file numbered after `number`: what a damage hides.
// Older ones are rows given back before, written over in later rounds of the ring.
std::size_t SqlitePendingRows::recordsNewerThan(std::uint64_t number) const
{
    std::size_t found = 0;
    for (std::uint64_t at = kHeaderBytes; at + kRecordHeaderBytes <= kFileBytes; at += 8) {
        const char* record = base_ + at;
        auto length = load<std::uint32_t>(record + 4);
        if (load<std::uint32_t>(record) != kRecordMagic || at + recordBytes(length) > kFileBytes ||
            checksum(record, length) != load<std::uint32_t>(record + 16))
            continue;
        found += load<std::uint64_t>(record + 8) > number ? 1 : 0;
        at += recordBytes(length) - 8;
    }
    return found;
}

std::string_view SqlitePendingRows::encode(SqliteWrite& write)
{
    // Kept from row to row, unless a large row grew it.
    constexpr std::size_t kKeptBytes = std::size_t{64} << 10;
    thread_local msgpack::sbuffer buffer;
    if (buffer.size() > kKeptBytes)
        buffer = msgpack::sbuffer();
    buffer.clear();
    // A row larger than the file is not copied only to find no room.
    std::size_t bytes = 0;
    for (auto& parameter : write.parameters) {
        if (auto* deferred = std::get_if<SqliteDeferredDictionary>(&parameter))
            parameter = (**deferred)();
        if (const auto* text = std::get_if<std::string>(&parameter))
            bytes += text->size();
        else if (const auto* dictionary = std::get_if<Dictionary>(&parameter))
            bytes += encodedMsgpackBytes(Value(*dictionary));
    }
    if (bytes > kFileBytes)
        return {};
    msgpack::packer packer(buffer);
    packer.pack_array(static_cast<std::uint32_t>(write.parameters.size() + 1));
    packer.pack_uint64(write.statement);
    for (const auto& parameter : write.parameters) {
        std::visit(
            [&](const auto& value) {
                using T = std::decay_t<decltype(value)>;
                if constexpr (std::is_same_v<T, std::nullptr_t>)
                    packer.pack_nil();
                else if constexpr (std::is_same_v<T, std::int64_t>)
                    packer.pack_int64(value);
                else if constexpr (std::is_same_v<T, double>)
                    packer.pack_double(value);
                else if constexpr (std::is_same_v<T, std::string>)
                    packer.pack_str(static_cast<std::uint32_t>(value.size()))
                        .pack_str_body(value.data(), static_cast<std::uint32_t>(value.size()));
                else if constexpr (std::is_same_v<T, Dictionary>)
                    encodeMsgpack(packer, Value(value));
            },
            parameter);
    }
    return {buffer.data(), buffer.size()};
}

// Where a record of `bytes` goes, with the zero word after it, if anywhere: after the
// newest record, or at the front when that is where the room is.
std::optional<std::uint64_t> SqlitePendingRows::placeFor(std::size_t bytes, bool& wraps)
{
    std::uint64_t needed = bytes + kTerminatorRoom;
    if (kept_.empty()) {
        if (kHeaderBytes + needed > kFileBytes)
            return std::nullopt;
        if (head_ != kHeaderBytes) {
            // Nothing is wanted: the front is marked empty and named before it is written over.
            store<std::uint32_t>(base_ + kHeaderBytes, 0);
            head_ = kHeaderBytes;
            publishTail();
        }
        return head_;
    }
    std::uint64_t oldest = tail();
    if (head_ > oldest) {
        if (head_ + needed <= kFileBytes)
            return head_;
        if (kHeaderBytes + needed <= oldest) {
            wraps = true;
            return kHeaderBytes;
        }
        return std::nullopt;
    }
    if (head_ + needed <= oldest)
        return head_;
    return std::nullopt;
}

std::uint64_t SqlitePendingRows::keep(std::string_view encoded)
{
    auto size = recordBytes(encoded.size());
    bool wraps = false;
    auto at = placeFor(size, wraps);
    if (!at)
        return 0;
    std::uint64_t number = next_++;
    char* record = base_ + *at;
    store<std::uint32_t>(record + 4, static_cast<std::uint32_t>(encoded.size()));
    store<std::uint64_t>(record + 8, number);
    store<std::uint32_t>(record + 20, 0);
    std::memcpy(record + kRecordHeaderBytes, encoded.data(), encoded.size());
    store<std::uint32_t>(record + 16, checksum(record, encoded.size()));
    store<std::uint32_t>(record + size, 0);
    publishMagic(record, kRecordMagic);
    if (wraps)
        publishMagic(base_ + head_, kWrapMagic);
    head_ = *at + size;
    kept_.push_back({number, *at});
    updateRoom();
    return number;
}

void SqlitePendingRows::release(std::uint64_t number)
{
    while (!kept_.empty() && kept_.front().number <= number)
        kept_.pop_front();
    publishTail();
    updateRoom();
}

void SqlitePendingRows::publishTail()
{
    std::atomic_ref(*reinterpret_cast<std::uint64_t*>(base_ + kTailOffset)).store(tail(), std::memory_order_release);
}

void SqlitePendingRows::updateRoom()
{
    std::uint64_t oldest = tail();
    std::uint64_t room = kFileBytes - kHeaderBytes;
    if (!kept_.empty())
        room = head_ > oldest ? std::max(kFileBytes - head_, oldest - kHeaderBytes) : oldest - head_;
    room_.store(room > kRecordHeaderBytes + kTerminatorRoom ? room - kRecordHeaderBytes - kTerminatorRoom : 0,
                std::memory_order_relaxed);
}

} // namespace mx
