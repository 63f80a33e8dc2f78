#pragma once
// One JSON file of etc/harmonia/ read strictly: a syntax error, a key the file may
// not have or a value of the wrong type is an error that names the file, the line and
// the column ("etc/harmonia/uplink.json:3:14: ..."), so that an operator can go
// straight to it. A file that is not there is no error: its defaults hold.

#include <filesystem>
#include <initializer_list>
#include <string>
#include <string_view>
#include <vector>

#include <nlohmann/json.hpp>

namespace mx {

class ConfigFile {
public:
    // Reads the file now; errors are added to `errors`.
    ConfigFile(std::filesystem::path path, std::vector<std::string>& errors);

    bool exists() const { return exists_; }
    // The document when the file exists and parses as JSON, else nullptr.
    const nlohmann::json* document() const { return parsed_ ? &document_ : nullptr; }

    // Adds an error at the first place `text` is written in the file (a key with its
    // quotes, a value), or at its start when it is not found.
    void fail(std::string_view text, const std::string& message);
    // Errors for every member of `object` that is not one of `allowed`; true if none.
    bool onlyKeys(const nlohmann::json& object, std::initializer_list<std::string_view> allowed, std::string_view what);
    // Whether `value` holds what `what` says; an error at `key` when not.
    bool expect(bool holds, std::string_view key, std::string_view what);

    const std::filesystem::path& path() const { return path_; }

private:
    std::string place(std::size_t offset) const;

    std::filesystem::path path_;
    std::vector<std::string>& errors_;
    std::string text_;
    bool exists_ = false;
    bool parsed_ = false;
    nlohmann::json document_;
};

} // namespace mx
