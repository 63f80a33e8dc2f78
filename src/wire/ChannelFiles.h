#pragma once
// Driver channels as files, as whoever drives the hardware writes them and the daemon
// and its tools read them: each channel is a regular file chanstat/GROUP/SUBGROUP/NAME
// (or chanstat/GROUP/NAME for a group without subgroups) holding one signed decimal
// 64-bit integer. Deeper files, and anything that is not a regular file, are not
// channels. Reads go through descriptors nothing on the other end can block.

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace mx {

struct ChannelFile {
    std::string name; // the file's name
    std::string path;
};

class ChannelFiles {
public:
    // What one reading of a set of channels (a driver's sample) may spend reading again
    // files caught being rewritten.
    static constexpr std::chrono::milliseconds kRereadTime{10};

    explicit ChannelFiles(std::filesystem::path directory);

    // The channel files of a group and subgroup (an absent name matches every one:
    // (G, none) is every channel under G/ and G/*/, (none, S) every one under */S/), in
    // path order. Nothing when no directory of the query exists; nothing, with the
    // errno in `error`, when one cannot be read.
    std::optional<std::vector<ChannelFile>> find(const std::optional<std::string>& group,
                                                 const std::optional<std::string>& subgroup, int& error) const;

    // The value in one channel file, or nothing with the errno in `error` (EINVAL for a
    // file that is not a regular file holding one integer). A file caught being
    // rewritten is read again until `retryUntil`: the time one sample has for that,
    // shared by its files.
    static std::optional<std::int64_t> readValue(const std::string& path, int& error,
                                                 std::chrono::steady_clock::time_point retryUntil);

private:
    std::filesystem::path directory_;
};

} // namespace mx
