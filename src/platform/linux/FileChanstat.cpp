#include "platform/linux/FileChanstat.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <unistd.h>

namespace mx {

namespace {

namespace fs = std::filesystem;

// The regular files directly in `directory`, added to `channels`. False, with the
// errno in `error`, when the directory cannot be read.
bool addChannelsIn(const fs::path& directory, ChanstatChannels& channels, std::optional<ChanstatError>& error)
{
    std::error_code failure;
    fs::directory_iterator entries(directory, failure);
    for (; !failure && entries != fs::directory_iterator(); entries.increment(failure))
        if (entries->symlink_status().type() == fs::file_type::regular)
            channels.push_back({entries->path().filename().string(), entries->path().string(), 0});
    if (failure) {
        error = ChanstatError{failure.value()};
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

// The value of one channel file, or the errno of what went wrong.
std::optional<std::int64_t> readValue(const std::string& path, int& error)
{
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) {
        error = errno;
        return std::nullopt;
    }
    char text[64];
    ssize_t length = ::read(fd, text, sizeof(text));
    error = length < 0 ? errno : 0;
    ::close(fd);
    if (length < 0)
        return std::nullopt;
    std::string_view number(text, std::size_t(length));
    auto space = [](char c) {
        return c == ' ' || c == '\t' || c == '\n' || c == '\r';
    };
    while (!number.empty() && space(number.front()))
        number.remove_prefix(1);
    while (!number.empty() && space(number.back()))
        number.remove_suffix(1);
    std::int64_t value = 0;
    auto [end, failure] = std::from_chars(number.data(), number.data() + number.size(), value);
    if (number.empty() || failure != std::errc() || end != number.data() + number.size() ||
        length == ssize_t(sizeof(text))) {
        error = EINVAL;
        return std::nullopt;
    }
    return value;
}

} // namespace

std::optional<ChanstatChannels> FileChanstat::copyChannelsInGroup(const std::optional<std::string>& group,
                                                                  const std::optional<std::string>& subgroup,
                                                                  std::optional<ChanstatError>& error)
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
    ChanstatChannels channels;
    for (const auto& each : directories)
        if (!addChannelsIn(each, channels, error))
            return std::nullopt;
    std::sort(channels.begin(), channels.end(), [](const auto& a, const auto& b) { return a.path < b.path; });
    return channels;
}

std::int32_t FileChanstat::getChannelCount(const ChanstatChannels& channels)
{
    return static_cast<std::int32_t>(channels.size());
}

ChanstatSubscription FileChanstat::createSubscription(const ChanstatChannels& channels,
                                                      ChanstatChannels& subscribedChannels)
{
    subscribedChannels = channels;
    return ++subscriptions_;
}

std::optional<ChanstatChannels> FileChanstat::createSamples(ChanstatSubscription,
                                                            const ChanstatChannels& subscribedChannels,
                                                            std::optional<ChanstatError>& error)
{
    ChanstatChannels samples = subscribedChannels;
    for (auto& channel : samples) {
        int failure = 0;
        auto value = readValue(channel.path, failure);
        if (!value) {
            error = ChanstatError{failure};
            return std::nullopt;
        }
        channel.value = *value;
    }
    return samples;
}

std::optional<ChanstatChannels> FileChanstat::createSamplesDelta(const ChanstatChannels* earlier,
                                                                 const ChanstatChannels& later,
                                                                 std::optional<ChanstatError>& error)
{
    if (!earlier) {
        error = ChanstatError{ENOENT};
        return std::nullopt;
    }
    ChanstatChannels delta = later;
    for (auto& channel : delta) {
        auto before = std::find_if(earlier->begin(), earlier->end(),
                                   [&](const ChanstatChannel& candidate) { return candidate.path == channel.path; });
        if (before == earlier->end()) {
            error = ChanstatError{ENOENT};
            return std::nullopt;
        }
        // A counter that wrapped around still gives its growth, without overflow.
        channel.value = static_cast<std::int64_t>(static_cast<std::uint64_t>(channel.value) -
                                                  static_cast<std::uint64_t>(before->value));
    }
    return delta;
}

} // namespace mx
