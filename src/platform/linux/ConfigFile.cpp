#include "platform/linux/ConfigFile.h"

#include <algorithm>
#include <fstream>
#include <sstream>

#include <fmt/format.h>

namespace mx {

ConfigFile::ConfigFile(std::filesystem::path path, std::vector<std::string>& errors)
    : path_(std::move(path)), errors_(errors)
{
    std::ifstream stream(path_);
    if (!stream)
        return;
    exists_ = true;
    std::ostringstream text;
    text << stream.rdbuf();
    text_ = text.str();
    try {
        document_ = nlohmann::json::parse(text_);
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

void ConfigFile::fail(std::string_view text, const std::string& message)
{
    auto at = text.empty() ? std::string::npos : text_.find(text);
    errors_.push_back(fmt::format("{}: {}", place(at == std::string::npos ? 0 : at), message));
}

bool ConfigFile::onlyKeys(const nlohmann::json& object, std::initializer_list<std::string_view> allowed,
                          std::string_view what)
{
    bool clean = true;
    for (const auto& [key, value] : object.items())
        if (std::find(allowed.begin(), allowed.end(), key) == allowed.end()) {
            std::string expected;
            for (auto name : allowed)
                expected += (expected.empty() ? "" : ", ") + std::string(name);
            fail("\"" + key + "\"", fmt::format("{} has no setting \"{}\" (it has {})", what, key, expected));
            clean = false;
        }
    return clean;
}

bool ConfigFile::expect(bool holds, std::string_view key, std::string_view what)
{
    if (!holds)
        fail("\"" + std::string(key) + "\"", fmt::format("\"{}\" must be {}", key, what));
    return holds;
}

} // namespace mx
