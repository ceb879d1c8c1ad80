#include "platform/linux/Notifications.h"

#include "platform/Uuid.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/UserDirectory.h"

#include <cerrno>
#include <cstdint>
#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr char momentaryMark = '@'; // between the name and the random part of a file that is there for a moment
constexpr int openFlags = O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK;
constexpr mode_t counterMode = 0644;

bool isUsable(const std::string& name) {
    return pathComponentError(name) == 0 && name.find(momentaryMark) == std::string::npos;
}

/// The counter file, made when missing. None when it is not a file of our own: others must not make us write to
/// something of their choosing.
Descriptor openCounter(const std::string& path) {
    Descriptor file(::open(path.c_str(), openFlags));
    if (!file && errno == ENOENT) file = Descriptor(::open(path.c_str(), openFlags | O_CREAT | O_EXCL, counterMode));
    if (!file && errno == EEXIST) file = Descriptor(::open(path.c_str(), openFlags)); // another poster was faster
    struct stat status{};
    if (!file || ::fstat(file.get(), &status) != 0) return Descriptor();
    if (!S_ISREG(status.st_mode) || status.st_uid != ::geteuid() || status.st_nlink != 1) return Descriptor();
    return file;
}

bool raise(int counter) {
    std::uint64_t count = 0;
    // Two posters at once may write the same number. Observers are told by the writing, not by the number.
    if (::pread(counter, &count, sizeof count, 0) < 0) return false;
    ++count;
    return ::pwrite(counter, &count, sizeof count, 0) == sizeof count;
}

} // namespace

Notifications::Notifications(const Root& root)
    : _directory(root.runtime() + "/notifications"),
      // One event for each post: the writing of a counter, but not its making, and the making of a momentary file.
      _watcher(_directory, IN_MODIFY | IN_CREATE,
               {.makeDirectory = [this] { makeDirectory(); },
                .changed =
                    [this](std::uint32_t mask, std::string_view entry) {
                        const auto mark = entry.find(momentaryMark);
                        const bool isMomentary = mark != std::string_view::npos;
                        if (isMomentary == ((mask & IN_CREATE) != 0)) {
                            _observers->notify(std::string(entry.substr(0, mark)));
                        }
                    },
                .missed = [this] { _observers->notifyAll(); }}) {}

void Notifications::makeDirectory() const {
    // Failures show when the directory is used.
    for (std::size_t end = _directory.find('/', 1); end != std::string::npos; end = _directory.find('/', end + 1)) {
        static_cast<void>(::mkdir(_directory.substr(0, end).c_str(), 0755));
    }
    // Sticky: everybody adds files, nobody removes those of others.
    if (::mkdir(_directory.c_str(), 0755) == 0) static_cast<void>(::chmod(_directory.c_str(), 01777));
}

void Notifications::post(const std::string& name) {
    if (!isUsable(name)) return;
    const std::string path = _directory + '/' + name;
    for (const bool isLastTry : {false, true}) {
        if (const Descriptor counter = openCounter(path); counter && raise(counter.get())) return;
        const std::string momentary = path + momentaryMark + UUID::random().text();
        if (const Descriptor file(::open(momentary.c_str(), openFlags | O_CREAT | O_EXCL, counterMode)); file) {
            ::unlink(momentary.c_str());
            return;
        }
        if (!isLastTry) makeDirectory();
    }
}

std::unique_ptr<NotificationObservation>
Notifications::observe(const std::string& name, std::shared_ptr<WorkQueue> queue, std::function<void()> handler) {
    _watcher.start();
    _watcher.drain(); // so that the new observer is not told of earlier posts
    return std::make_unique<QueuedObservation<NotificationObservation>>(
        _observers, _observers->add(name, std::move(queue), std::move(handler)));
}

} // namespace platform::linux_
