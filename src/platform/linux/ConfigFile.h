#pragma once
// One JSON file of etc/harmonia/ (comments, // and /* */, allowed) read strictly: a
// syntax error, a key the file may not have or a value of the wrong type is an error
// that names the file, the line and the column of the setting, and the setting itself
// ("etc/harmonia/stores.json:3:18: joule.max_bytes must be ..."), so that an operator
// can go straight to it. A file that is not there is no error: its defaults hold. One
// that is there and cannot be read, or is not a regular file, is an error, never taken
// for an absent one: files are opened so that nothing at the other end can block the
// open (a FIFO put in a file's place), and checked on the open descriptor.

#include <filesystem>
#include <initializer_list>
#include <string>
#include <string_view>
#include <vector>

#include <sys/types.h>

#include <nlohmann/json.hpp>

namespace mx {

class ConfigFile {
public:
    using Pointer = nlohmann::json::json_pointer;

    // A file the configuration reads, as it was read.
    struct Read {
        enum class Outcome { Missing, Read, Refused } outcome = Outcome::Missing;
        std::string contents;
        std::string problem; // why it was refused, with what to mend
        uid_t owner = 0;
        mode_t mode = 0;
    };
    // Reads `path` if it is a regular file of at most `largest` bytes.
    static Read readRegularFile(const std::filesystem::path& path, std::size_t largest);

    // Reads the file now; errors are added to `errors`.
    ConfigFile(std::filesystem::path path, std::vector<std::string>& errors);

    bool exists() const { return exists_; }
    // The document when the file exists and parses as JSON, else nullptr.
    const nlohmann::json* document() const { return parsed_ ? &document_ : nullptr; }

    // Adds an error placed at the value `at` points to.
    void fail(const Pointer& at, const std::string& message);
    // The same, the message led by the setting's name ("tls.ca_file: ...").
    void failSetting(const Pointer& at, const std::string& message);
    // Errors, each at its key, for every member of the object at `at` that is not one
    // of `allowed`; true if none.
    bool onlyKeys(const Pointer& at, std::initializer_list<std::string_view> allowed);
    // Whether the value at `at` holds what `what` says; an error naming the setting
    // when not ("joule.max_bytes must be a number of at least 0").
    bool expect(bool holds, const Pointer& at, std::string_view what);
    // The setting `at` points to as an operator writes it: "backends[1].headers.Key",
    // the file's name for the whole document.
    std::string settingName(const Pointer& at) const;

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
