#include "platform/linux/ConfigFile.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <system_error>
#include <unistd.h>

#include <fmt/format.h>

#include "platform/linux/PosixFileSystem.h"

namespace mx {

namespace {

// A configuration file is a few kilobytes; anything near this is no configuration.
constexpr std::size_t kLargestFile = std::size_t{1} << 20;

std::vector<std::string> tokensOf(ConfigFile::Pointer at)
{
    std::vector<std::string> tokens;
    for (; !at.empty(); at = at.parent_pointer())
        tokens.push_back(at.back());
    std::reverse(tokens.begin(), tokens.end());
    return tokens;
}

// Finds where a value begins in JSON text that is known to parse: nlohmann's
// documents keep no positions, and an error placed by searching for the key's text
// would land on the first setting of that name, in whichever section it is.
class JsonTextLocator {
public:
    explicit JsonTextLocator(std::string_view text) : text_(text) {}

    // The offset of the value at `tokens`, or of its key when `atKey` and it is an
    // object's member; 0 when it is not there.
    std::size_t find(const std::vector<std::string>& tokens, bool atKey)
    {
        std::size_t key = std::string_view::npos;
        at_ = 0;
        for (const auto& token : tokens) {
            space();
            key = std::string_view::npos;
            if (peek() == '{') {
                key = member(token);
                if (key == std::string_view::npos)
                    return 0;
            } else if (peek() != '[' || !element(token)) {
                return 0;
            }
        }
        space();
        return atKey && key != std::string_view::npos ? key : at_;
    }

private:
    char peek() const { return at_ < text_.size() ? text_[at_] : '\0'; }
    // Blanks and comments.
    void space()
    {
        for (;;) {
            while (at_ < text_.size() && std::isspace(static_cast<unsigned char>(text_[at_])))
                ++at_;
            if (text_.substr(at_, 2) == "//")
                at_ = std::min(text_.find('\n', at_), text_.size());
            else if (text_.substr(at_, 2) == "/*")
                at_ = std::min(text_.find("*/", at_ + 2), text_.size() - 2) + 2;
            else
                return;
        }
    }
    void string()
    {
        for (++at_; at_ < text_.size() && text_[at_] != '"'; ++at_)
            if (text_[at_] == '\\')
                ++at_;
        ++at_;
    }
    void value()
    {
        space();
        if (peek() == '"')
            return string();
        if (peek() != '{' && peek() != '[') {
            while (at_ < text_.size() && !std::strchr(",}] \t\r\n/", text_[at_]))
                ++at_;
            return;
        }
        int depth = 0;
        do {
            char c = text_[at_];
            if (c == '"') {
                string();
                continue;
            }
            if (c == '/') {
                space();
                continue;
            }
            depth += (c == '{' || c == '[') ? 1 : (c == '}' || c == ']') ? -1 : 0;
            ++at_;
        } while (depth > 0 && at_ < text_.size());
    }
    void separator()
    {
        space();
        if (peek() == ',')
            ++at_;
    }
    // Moves to the value of member `name`; where its key begins, npos when absent.
    std::size_t member(const std::string& name)
    {
        ++at_;
        for (;;) {
            space();
            if (peek() != '"')
                return std::string_view::npos;
            std::size_t key = at_;
            string();
            bool found = nlohmann::json::parse(text_.substr(key, at_ - key)).get<std::string>() == name;
            space();
            ++at_; // ':'
            space();
            if (found)
                return key;
            value();
            separator();
        }
    }
    // Moves to element `index` of an array; false when it has fewer.
    bool element(const std::string& index)
    {
        if (index.empty() || !std::all_of(index.begin(), index.end(), ::isdigit))
            return false;
        ++at_;
        for (std::size_t n = 0, wanted = std::stoul(index);; ++n) {
            space();
            if (peek() == ']' || peek() == '\0')
                return false;
            if (n == wanted)
                return true;
            value();
            separator();
        }
    }

    std::string_view text_;
    std::size_t at_ = 0;
};

} // namespace

ConfigFile::Read ConfigFile::readRegularFile(const std::filesystem::path& path, std::size_t largest)
{
    Read read;
    int fd = ::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
    if (fd < 0) {
        int error = errno;
        if (error == ENOENT)
            return read;
        read.outcome = Read::Outcome::Refused;
        read.problem = fmt::format("{} cannot be read: {}{}", path.string(), std::generic_category().message(error),
                                   PosixFileSystem::refusalHint(error, path));
        return read;
    }
    read.outcome = Read::Outcome::Refused;
    struct stat file {};
    if (::fstat(fd, &file) != 0 || !S_ISREG(file.st_mode)) {
        read.problem = fmt::format("{} is not a regular file", path.string());
    } else if (static_cast<std::uint64_t>(file.st_size) > largest) {
        read.problem = fmt::format("{} is larger than {} bytes", path.string(), largest);
    } else {
        read.contents.resize(static_cast<std::size_t>(file.st_size));
        ssize_t got = ::read(fd, read.contents.data(), read.contents.size());
        if (got == static_cast<ssize_t>(read.contents.size())) {
            read.outcome = Read::Outcome::Read;
            read.owner = file.st_uid;
            read.mode = file.st_mode & 07777;
        } else {
            read.problem = fmt::format("{} cannot be read: {}", path.string(),
                                       got < 0 ? std::generic_category().message(errno) : "it changed as it was read");
        }
    }
    ::close(fd);
    return read;
}

ConfigFile::ConfigFile(std::filesystem::path path, std::vector<std::string>& errors)
    : path_(std::move(path)), errors_(errors)
{
    auto read = readRegularFile(path_, kLargestFile);
    if (read.outcome == Read::Outcome::Missing)
        return;
    exists_ = true;
    if (read.outcome == Read::Outcome::Refused) {
        errors_.push_back(read.problem);
        return;
    }
    text_ = std::move(read.contents);
    try {
        document_ = nlohmann::json::parse(text_, nullptr, true, /*ignore_comments=*/true);
        parsed_ = true;
    } catch (const nlohmann::json::parse_error& error) {
        // The library's message leads with its own position; ours is in front.
        std::string what = error.what();
        if (auto detail = what.find(": syntax error"); detail != std::string::npos)
            what = what.substr(detail + 2);
        errors_.push_back(fmt::format("{}: {}", place(error.byte > 0 ? error.byte - 1 : 0), what));
    }
}

std::string ConfigFile::place(std::size_t offset) const
{
    offset = std::min(offset, text_.size());
    std::size_t line = 1 +
        static_cast<std::size_t>(std::count(text_.begin(), text_.begin() + static_cast<std::ptrdiff_t>(offset), '\n'));
    std::size_t lineStart = text_.rfind('\n', offset == 0 ? 0 : offset - 1);
    std::size_t column = offset - (lineStart == std::string::npos || offset == 0 ? 0 : lineStart + 1) + 1;
    return fmt::format("{}:{}:{}", path_.string(), line, column);
}

std::string ConfigFile::settingName(const Pointer& at) const
{
    std::string name;
    const nlohmann::json* node = &document_;
    for (const auto& token : tokensOf(at)) {
        if (node && node->is_array()) {
            name += "[" + token + "]";
            node = &(*node)[std::stoul(token)];
            continue;
        }
        name += (name.empty() ? "" : ".") + token;
        node = node && node->is_object() && node->contains(token) ? &(*node)[token] : nullptr;
    }
    return name.empty() ? path_.filename().string() : name;
}

void ConfigFile::fail(const Pointer& at, const std::string& message)
{
    errors_.push_back(fmt::format("{}: {}", place(JsonTextLocator(text_).find(tokensOf(at), false)), message));
}

void ConfigFile::failSetting(const Pointer& at, const std::string& message)
{
    fail(at, settingName(at) + ": " + message);
}

bool ConfigFile::onlyKeys(const Pointer& at, std::initializer_list<std::string_view> allowed)
{
    bool clean = true;
    for (const auto& [key, value] : document_.at(at).items())
        if (std::find(allowed.begin(), allowed.end(), key) == allowed.end()) {
            std::string expected;
            for (auto name : allowed)
                expected += (expected.empty() ? "" : ", ") + std::string(name);
            errors_.push_back(fmt::format("{}: {} has no setting \"{}\" (it has {})",
                                          place(JsonTextLocator(text_).find(tokensOf(at / key), true)), settingName(at),
                                          key, expected));
            clean = false;
        }
    return clean;
}

bool ConfigFile::expect(bool holds, const Pointer& at, std::string_view what)
{
    if (!holds)
        fail(at, fmt::format("{} must be {}", settingName(at), what));
    return holds;
}

} // namespace mx
