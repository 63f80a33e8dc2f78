#include "wire/ChannelFiles.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <random>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace mx {

namespace {

namespace fs = std::filesystem;

// A channel's text is one 64-bit integer and a line end, with room for white space.
constexpr std::size_t kLongestText = 63;
// A rewrite in place leaves the file empty for microseconds, or for as long as the
// writer is preempted between its truncation and its write: the first reads again
// come at once, the later ones after growing pauses with a random part, so that a
// reader and a writer woken by the same timer tick do not meet at the same moment
// again; all of them within the time the whole sample has for reading again. A file
// that was not written in the last second (a time in the future included: no writer
// of this host gives one) is not being rewritten: what it holds is final at once.
constexpr int kReadAttempts = 9;
constexpr auto kRewriteWindow = std::chrono::seconds(1);
constexpr int kImmediateAttempts = 2;
constexpr auto kFirstPause = std::chrono::microseconds(25);

void pauseBeforeAttempt(int attempt, std::chrono::steady_clock::time_point retryUntil)
{
    if (attempt < kImmediateAttempts) {
        std::this_thread::yield();
        return;
    }
    thread_local std::minstd_rand random(static_cast<unsigned>(std::random_device{}()));
    auto base = kFirstPause * (1 << (2 * (attempt - kImmediateAttempts)));
    auto pause = std::chrono::duration_cast<std::chrono::steady_clock::duration>(base + base * (random() % 200) / 100);
    std::this_thread::sleep_for(std::min(pause, retryUntil - std::chrono::steady_clock::now()));
}

bool writtenInTheLastSecond(const timespec& modified)
{
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    auto age =
        std::chrono::seconds(now.tv_sec - modified.tv_sec) + std::chrono::nanoseconds(now.tv_nsec - modified.tv_nsec);
    return age >= std::chrono::nanoseconds(0) && age <= kRewriteWindow;
}

// The regular files directly in `directory`, added to `channels`. False, with the
// errno in `error`, when the directory cannot be read.
bool addChannelsIn(const fs::path& directory, std::vector<ChannelFile>& channels, int& error)
{
    std::error_code failure;
    fs::directory_iterator entries(directory, failure);
    for (; !failure && entries != fs::directory_iterator(); entries.increment(failure))
        if (entries->symlink_status().type() == fs::file_type::regular)
            channels.push_back({entries->path().filename().string(), entries->path().string()});
    if (failure) {
        error = failure.value();
        return false;
    }
    return true;
}

// The directories directly in `directory`, in no particular order.
std::vector<fs::path> subdirectories(const fs::path& directory)
{
    std::vector<fs::path> found;
    std::error_code failure;
    for (fs::directory_iterator entries(directory, failure); !failure && entries != fs::directory_iterator();
         entries.increment(failure))
        if (entries->symlink_status().type() == fs::file_type::directory)
            found.push_back(entries->path());
    return found;
}

bool isDirectory(const fs::path& path)
{
    std::error_code failure;
    return fs::symlink_status(path, failure).type() == fs::file_type::directory;
}

// A channel file's text, read through a descriptor that nothing on the other end can
// block: opened without waiting (a FIFO put in a file's place opens at once) and
// taken only when it is a regular file.
bool readText(const std::string& path, std::string& text, bool& recentlyWritten, int& error)
{
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    if (fd < 0) {
        error = errno;
        return false;
    }
    struct stat status {};
    if (::fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
        error = EINVAL;
        ::close(fd);
        return false;
    }
    recentlyWritten = writtenInTheLastSecond(status.st_mtim);
    char buffer[kLongestText + 1];
    ssize_t length = ::read(fd, buffer, sizeof(buffer));
    error = length < 0 ? errno : 0;
    ::close(fd);
    if (length < 0)
        return false;
    text.assign(buffer, std::size_t(length));
    return true;
}

// One signed decimal 64-bit integer, surrounding white space ignored.
std::optional<std::int64_t> parseValue(std::string_view number)
{
    auto space = [](char c) {
        return c == ' ' || c == '\t' || c == '\n' || c == '\r';
    };
    while (!number.empty() && space(number.front()))
        number.remove_prefix(1);
    while (!number.empty() && space(number.back()))
        number.remove_suffix(1);
    std::int64_t value = 0;
    auto [end, failure] = std::from_chars(number.data(), number.data() + number.size(), value);
    if (number.empty() || failure != std::errc() || end != number.data() + number.size())
        return std::nullopt;
    return value;
}

} // namespace

ChannelFiles::ChannelFiles(std::filesystem::path directory) : directory_(std::move(directory)) {}

std::optional<std::vector<ChannelFile>> ChannelFiles::find(const std::optional<std::string>& group,
                                                           const std::optional<std::string>& subgroup, int& error) const
{
    // Where the channels of the query live: a group's own directory and each of its
    // subgroups', or one subgroup's across every group.
    std::vector<fs::path> directories;
    if (group && subgroup) {
        directories.push_back(directory_ / *group / *subgroup);
    } else if (group) {
        directories.push_back(directory_ / *group);
        for (auto& sub : subdirectories(directory_ / *group))
            directories.push_back(std::move(sub));
    } else {
        for (const auto& each : subdirectories(directory_)) {
            if (!subgroup) {
                directories.push_back(each);
                for (auto& sub : subdirectories(each))
                    directories.push_back(std::move(sub));
            } else if (isDirectory(each / *subgroup)) {
                directories.push_back(each / *subgroup);
            }
        }
    }
    std::erase_if(directories, [](const fs::path& path) { return !isDirectory(path); });
    if (directories.empty())
        return std::nullopt;
    std::vector<ChannelFile> channels;
    for (const auto& each : directories)
        if (!addChannelsIn(each, channels, error))
            return std::nullopt;
    std::sort(channels.begin(), channels.end(), [](const auto& a, const auto& b) { return a.path < b.path; });
    return channels;
}

// The value of one channel file, or the errno of what went wrong. A writer that
// rewrites the file in place (`echo N > file`) empties it before it writes, so a read
// may find nothing, or the first part of a number: such a read is tried again while
// there is time, and a value without its line end is taken once two reads agree on it.
std::optional<std::int64_t> ChannelFiles::readValue(const std::string& path, int& error,
                                                    std::chrono::steady_clock::time_point retryUntil)
{
    std::optional<std::int64_t> previous;
    for (int attempt = 0; attempt < kReadAttempts; ++attempt) {
        if (attempt > 0 && std::chrono::steady_clock::now() >= retryUntil)
            break;
        std::string text;
        bool recentlyWritten = false;
        if (!readText(path, text, recentlyWritten, error))
            return std::nullopt;
        auto value = text.size() <= kLongestText ? parseValue(text) : std::nullopt;
        if (value && (text.ends_with('\n') || value == previous || !recentlyWritten))
            return value;
        if (!recentlyWritten)
            break;
        previous = value;
        if (!value)
            pauseBeforeAttempt(attempt, retryUntil);
    }
    error = EINVAL;
    return std::nullopt;
}

} // namespace mx
