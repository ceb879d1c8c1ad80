#include "platform/linux/RegistryWatcher.h"

#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/ProcPath.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <unistd.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::uint32_t passageEvents = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB;
constexpr std::uint32_t contentEvents = passageEvents | IN_CLOSE_WRITE | IN_DELETE_SELF | IN_MOVE_SELF;

bool leadsTo(const std::string& path, int directory) {
    FileStatus there;
    FileStatus here;
    return readFileStatus(AT_FDCWD, path.c_str(), there) == 0 && readFileStatus(directory, "", here) == 0 &&
           there.identity == here.identity;
}

} // namespace

RegistryWatcher::RegistryWatcher(std::size_t limit) : _limit(limit) { become({}); }

bool RegistryWatcher::isSilent(int descriptor) {
    std::error_code error;
    const auto kind = std::filesystem::read_symlink(procPath(descriptor), error);
    int waiting = 0;
    return kind == "anon_inode:inotify" && ioctl(descriptor, FIONREAD, &waiting) == 0 && waiting == 0;
}

void RegistryWatcher::become(Descriptor inotify) {
    _inotify = inotify ? std::move(inotify) : Descriptor(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
}

void RegistryWatcher::watch(int directory, const std::string& path, Role role) {
    const std::uint32_t events = (role == Role::content ? contentEvents : passageEvents) | IN_ONLYDIR | IN_MASK_ADD;
    const auto known = _watches.find(path);
    const bool isFull = known == _watches.end() && _watches.size() >= _limit;
    // Through the descriptor: so the directory that is watched is the one that is read, whatever the path names now.
    const int descriptor = isFull ? -1 : inotify_add_watch(_inotify.get(), procPath(directory).c_str(), events);
    if (descriptor < 0) {
        // A directory that may not be read tells by its parent when that changes; all other failures are shortages.
        if (isFull || errno != EACCES) _unwatched.insert(path);
        return;
    }
    _unwatched.erase(path);
    if (known != _watches.end() && known->second.descriptor == descriptor) {
        known->second.round = _round;
        return;
    }
    // A watch belongs to the directory. One that lies under two paths is heard of under the later one only.
    const auto other = _byDescriptor.find(descriptor);
    if (other != _byDescriptor.end() && leadsTo(other->second->first, directory))
        _unwatched.insert(other->second->first);
    // Another directory stands at the path, or the directory stood at another path.
    if (known != _watches.end()) {
        inotify_rm_watch(_inotify.get(), known->second.descriptor);
        forget(known->second.descriptor);
    }
    forget(descriptor);
    const auto added = _watches.emplace(path, Watch{descriptor, _round}).first;
    _byDescriptor.emplace(descriptor, added);
}

void RegistryWatcher::forget(int descriptor) {
    const auto found = _byDescriptor.find(descriptor);
    if (found == _byDescriptor.end()) return;
    _watches.erase(found->second);
    _byDescriptor.erase(found);
}

void RegistryWatcher::beginRound(const std::set<std::string>& places) {
    ++_round;
    std::erase_if(_unwatched, [&](const auto& path) {
        return std::ranges::any_of(places, [&](const auto& place) { return isAtOrBelow(path, place); });
    });
}

void RegistryWatcher::endRound(const std::set<std::string>& places) {
    for (const auto& place : places) {
        for (auto next = _watches.lower_bound(place); next != _watches.end() && next->first.starts_with(place);) {
            const auto& [path, watch] = *next++;
            if (watch.round == _round || !isAtOrBelow(path, place)) continue;
            inotify_rm_watch(_inotify.get(), watch.descriptor);
            forget(watch.descriptor);
        }
    }
}

bool RegistryWatcher::read(std::vector<Event>& events) {
    bool isComplete = true;
    int waiting = 0;
    // No more than waits now: under a steady stream of changes the reader must come to an end.
    if (ioctl(_inotify.get(), FIONREAD, &waiting) != 0) return true;
    alignas(inotify_event) std::array<char, 65536> buffer;
    while (waiting > 0) {
        const ssize_t size = ::read(_inotify.get(), buffer.data(), buffer.size());
        if (size < 0 && errno == EINTR) continue;
        if (size <= 0) break;
        waiting -= static_cast<int>(size);
        for (std::size_t at = 0; at < static_cast<std::size_t>(size);) {
            inotify_event event{};
            std::memcpy(&event, buffer.data() + at, sizeof event);
            const char* name = buffer.data() + at + sizeof event;
            at += sizeof event + event.len;
            if ((event.mask & IN_Q_OVERFLOW) != 0) isComplete = false;
            const auto watch = _byDescriptor.find(event.wd);
            if (watch == _byDescriptor.end()) continue; // from before the watch was ended
            if ((event.mask & IN_IGNORED) != 0) {
                forget(event.wd);
                continue;
            }
            events.push_back({watch->second->first, event.len > 0 ? std::string(name) : std::string(), event.mask});
        }
    }
    return isComplete;
}

} // namespace platform::linux_
