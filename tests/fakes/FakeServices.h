#pragma once
// Small working stand-ins for the process-wide platform services: each records what
// the daemon handed it, for the test to assert on. All are thread-safe.

#include <map>
#include <mutex>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "platform/DeviceProperties.h"
#include "platform/FileSystem.h"
#include "platform/Joule.h"
#include "platform/Orientation.h"
#include "platform/Tally.h"
#include "platform/TracePoints.h"

namespace mx::testing {

// A thread-safe list of what a fake was handed, in order.
template <class Item>
class Recorder {
public:
    void record(Item item)
    {
        std::lock_guard lock(mutex_);
        items_.push_back(std::move(item));
    }
    std::vector<Item> all() const
    {
        std::lock_guard lock(mutex_);
        return items_;
    }
    void clear()
    {
        std::lock_guard lock(mutex_);
        items_.clear();
    }

private:
    mutable std::mutex mutex_;
    std::vector<Item> items_;
};

// One ordered record of the effects of several fakes ("trace 0x21042838",
// "tally com.kestrel...", "joule Tessera_Haptics"), for tests of the order of effects.
class EffectJournal : public Recorder<std::string> {
public:
    std::vector<std::string> effects() const { return all(); }
};

class RecordingTracePoints final : public TracePoints {
public:
    explicit RecordingTracePoints(EffectJournal& journal) : journal_(journal) {}
    void emit(std::uint32_t code, std::uint64_t, std::uint64_t, std::uint64_t, std::uint64_t) override
    {
        journal_.record(fmt::format("trace {:#x}", code));
        codes_.record(code);
    }
    std::vector<std::uint32_t> codes() const { return codes_.all(); }
    void clear() { codes_.clear(); }

private:
    EffectJournal& journal_;
    Recorder<std::uint32_t> codes_;
};

struct TallyEvent {
    std::string name;
    Dictionary payload;
};

class FakeTally final : public Tally {
public:
    explicit FakeTally(EffectJournal& journal) : journal_(journal) {}
    void sendEventLazy(std::string_view name, UniqueFunction<Dictionary()> buildPayload) override
    {
        journal_.record(fmt::format("tally {}", name));
        events_.record({std::string(name), buildPayload()});
    }
    std::vector<TallyEvent> events() const { return events_.all(); }

private:
    EffectJournal& journal_;
    Recorder<TallyEvent> events_;
};

struct JouleEvent {
    std::int32_t agent;
    std::string name;
    Dictionary event;
};

class FakeJoule final : public Joule {
public:
    explicit FakeJoule(EffectJournal& journal) : journal_(journal) {}
    void logRegisteredEvent(std::int32_t agent, std::string_view name, Dictionary event, const Dictionary*) override
    {
        journal_.record(fmt::format("joule {}", name));
        events_.record({agent, std::string(name), std::move(event)});
    }
    std::vector<JouleEvent> events() const { return events_.all(); }

private:
    EffectJournal& journal_;
    Recorder<JouleEvent> events_;
};

class FakeDeviceProperties final : public DeviceProperties {
public:
    bool boolProperty(std::string_view key) override
    {
        std::lock_guard lock(mutex_);
        ++queries_;
        return bools_.count(std::string(key)) ? bools_[std::string(key)] : false;
    }
    std::int64_t integerProperty(std::string_view key) override
    {
        std::lock_guard lock(mutex_);
        ++queries_;
        return integers_.count(std::string(key)) ? integers_[std::string(key)] : 0;
    }
    void setInteger(const std::string& key, std::int64_t value)
    {
        std::lock_guard lock(mutex_);
        integers_[key] = value;
    }
    void setBool(const std::string& key, bool value)
    {
        std::lock_guard lock(mutex_);
        bools_[key] = value;
    }
    int queries() const
    {
        std::lock_guard lock(mutex_);
        return queries_;
    }

private:
    mutable std::mutex mutex_;
    std::map<std::string, bool> bools_;
    std::map<std::string, std::int64_t> integers_;
    int queries_ = 0;
};

// Registrations by identifier; change() runs the callbacks of a kind on the caller's
// thread. An unregistration waits for a change in progress, as the service's does.
class FakeOrientation final : public Orientation {
public:
    explicit FakeOrientation(EffectJournal& journal) : journal_(journal) {}
    void registerDeviceOrientation(const std::string& id, std::function<void(int)> callback) override
    {
        enter("register device", id, std::move(callback));
    }
    void registerUIOrientation(const std::string& id, std::function<void(int)> callback) override
    {
        enter("register ui", id, std::move(callback));
    }
    void unregisterDeviceOrientation(const std::string& id) override { enter("unregister device", id, nullptr); }
    void unregisterUIOrientation(const std::string& id) override { enter("unregister ui", id, nullptr); }
    std::string orientationName(int orientation) override { return fmt::format("orientation-{}", orientation); }

    // `kind` is "device" or "ui".
    void change(const std::string& kind, int orientation)
    {
        std::lock_guard lock(mutex_);
        for (const auto& [key, callback] : callbacks_)
            if (key.first == kind)
                callback(orientation);
    }
    std::size_t registrations() const
    {
        std::lock_guard lock(mutex_);
        return callbacks_.size();
    }
    void clear()
    {
        std::lock_guard lock(mutex_);
        callbacks_.clear();
    }

private:
    void enter(const std::string& what, const std::string& id, std::function<void(int)> callback)
    {
        std::lock_guard lock(mutex_);
        journal_.record(fmt::format("orientation {} {}", what, id));
        std::string kind = what.substr(what.find(' ') + 1);
        if (callback)
            callbacks_[{kind, id}] = std::move(callback);
        else
            callbacks_.erase({kind, id});
    }

    EffectJournal& journal_;
    mutable std::recursive_mutex mutex_;
    std::map<std::pair<std::string, std::string>, std::function<void(int)>> callbacks_;
};

// Files kept in memory: what was written where, and directories that fail on demand.
class FakeFileSystem final : public FileSystem {
public:
    std::filesystem::path resolve(const std::string& path) override { return "/root" + path; }
    std::optional<std::string> createDirectories(const std::filesystem::path& directory, mode_t mode,
                                                 FileModes) override
    {
        std::lock_guard lock(mutex_);
        directories[directory] = mode;
        return directoryFailure;
    }
    std::optional<std::string> writeAtomically(const std::filesystem::path& file, std::string_view contents, mode_t,
                                               Durability) override
    {
        std::lock_guard lock(mutex_);
        if (directoryFailure)
            return std::string("No such file or directory");
        files[file] = std::string(contents);
        return std::nullopt;
    }

    std::size_t trimDirectory(const std::filesystem::path&, std::size_t, std::uint64_t) override { return 0; }

    std::map<std::filesystem::path, mode_t> directories;
    std::map<std::filesystem::path, std::string> files;
    std::optional<std::string> directoryFailure;

private:
    std::mutex mutex_;
};

} // namespace mx::testing
