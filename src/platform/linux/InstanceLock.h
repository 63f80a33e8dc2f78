#pragma once
// One daemon per root: an exclusive lock on a file that the daemon holds for as long
// as it runs, taken before it touches the socket or the stores. The file names the
// holder's pid, for the message a second daemon gives. Owned by main.

#include <filesystem>
#include <memory>
#include <string>

namespace mx {

class InstanceLock {
public:
    // The lock, or nothing with `error` set: another daemon holds it, or the file
    // cannot be made.
    static std::unique_ptr<InstanceLock> acquire(const std::filesystem::path& path, std::string& error);
    ~InstanceLock();
    InstanceLock(const InstanceLock&) = delete;
    InstanceLock& operator=(const InstanceLock&) = delete;

private:
    explicit InstanceLock(int fd) : fd_(fd) {}
    int fd_;
};

} // namespace mx
