#pragma once

#include "platform/linux/Descriptor.h"

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace platform::linux_ {

/// Watches any number of directories for changes of their entries (inotify(7)). For one thread.
class RegistryWatcher {
public:
    struct Event {
        std::string directory; // by the path under which it was last watched
        std::string name;      // of the entry; empty when the directory itself went
        std::uint32_t mask = 0;
    };
    enum class Role {
        content, // everything that happens to the entries counts
        passage, // only entries that come and go
    };

    /// Never watches more than `limit` directories.
    explicit RegistryWatcher(std::size_t limit);

    /// Readable when events wait. Negative when the system has no inotify left.
    int descriptor() const { return _inotify.get(); }

    /// Whether it is the descriptor of a watcher with no event waiting: nothing happened in what that one watches since
    /// it was last read.
    static bool isSilent(int descriptor);
    /// From here on this watcher is the one with that descriptor; with none, a new one. Before anything is watched.
    void become(Descriptor inotify);

    /// Watches the open directory under the name `path`, also when it is watched already.
    void watch(int directory, const std::string& path, Role role);

    /// Between the two everything at and below `places` is watched anew: what was not, is no longer watched then.
    void beginRound(const std::set<std::string>& places);
    void endRound(const std::set<std::string>& places);

    /// Takes the events that wait now. False when some were lost.
    bool read(std::vector<Event>& events);

    /// The directories for which no watch could be had, or not one under each of two paths.
    const std::set<std::string>& unwatched() const { return _unwatched; }

private:
    struct Watch {
        int descriptor;
        std::uint64_t round;
    };
    using Watches = std::map<std::string, Watch, std::less<>>;

    void forget(int descriptor);

    const std::size_t _limit;
    Descriptor _inotify;
    std::uint64_t _round = 0;
    Watches _watches; // by path
    std::unordered_map<int, Watches::iterator> _byDescriptor;
    std::set<std::string> _unwatched;
};

} // namespace platform::linux_
