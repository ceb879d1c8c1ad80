#include "platform/linux/DirectoryWatcher.h"

#include "platform/linux/ServiceThread.h"

#include <array>
#include <cerrno>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>

namespace platform::linux_ {

namespace {

constexpr int retryMilliseconds = 1000; // seldom enough to cost nothing, often enough for a person who waits
constexpr std::size_t bufferSize = 16384;
constexpr std::uint32_t directoryEvents = IN_ONLYDIR | IN_DELETE_SELF | IN_MOVE_SELF;
constexpr std::uint32_t parentEvents = IN_ONLYDIR | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;

} // namespace

DirectoryWatcher::DirectoryWatcher(std::string directory, std::uint32_t events, Callbacks callbacks)
    : _directory(std::move(directory)),
      _parent(_directory.substr(0, _directory.rfind('/') + 1)),
      _name(_directory.substr(_directory.rfind('/') + 1)),
      _events(events),
      _callbacks(std::move(callbacks)) {}

DirectoryWatcher::~DirectoryWatcher() {
    if (!_thread) return;
    {
        const std::lock_guard lock(_mutex);
        _isStopping = true;
    }
    ::eventfd_write(_wakeUp.get(), 1);
    _thread->join();
}

bool DirectoryWatcher::start() {
    const std::lock_guard lock(_mutex);
    if (!_wakeUp) _wakeUp = Descriptor(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (_wakeUp && !_thread) {
        watch();
        _thread = startServiceThread("watcher", [this] { run(); });
    }
    return _thread && _watch >= 0;
}

void DirectoryWatcher::drain() {
    const std::lock_guard lock(_mutex);
    drainLocked();
    if (_thread && _watch < 0) ::eventfd_write(_wakeUp.get(), 1); // it waits without a time-out
}

void DirectoryWatcher::run() {
    for (;;) {
        std::array<pollfd, 2> descriptors{};
        int timeout = -1;
        {
            const std::lock_guard lock(_mutex);
            if (_isStopping) return;
            if (_watch < 0) timeout = retryMilliseconds;
            descriptors = {pollfd{_wakeUp.get(), POLLIN, 0}, pollfd{_inotify.get(), POLLIN, 0}};
        }
        ::poll(descriptors.data(), descriptors.size(), timeout);

        const std::lock_guard lock(_mutex);
        eventfd_t ignored = 0;
        ::eventfd_read(_wakeUp.get(), &ignored);
        if (_watch < 0) watch();
        drainLocked();
    }
}

void DirectoryWatcher::watch() {
    if (!_inotify) _inotify = Descriptor(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    if (!_inotify) return;

    _callbacks.makeDirectory();
    // The parent first: whatever takes the directory's place after it was opened is then told.
    const auto renew = [&](int& watch, const std::string& path, std::uint32_t events) {
        const int former = std::exchange(watch, ::inotify_add_watch(_inotify.get(), path.c_str(), events));
        if (former >= 0 && former != watch) ::inotify_rm_watch(_inotify.get(), former);
        return former != watch;
    };
    renew(_parentWatch, _parent, parentEvents);
    const bool isRenewed = renew(_watch, _directory, _events | directoryEvents);
    // The first time, before there is a thread, nobody has relied on being told yet.
    if (isRenewed && _watch >= 0 && _thread) _callbacks.missed();
}

void DirectoryWatcher::drainLocked() {
    // What is pending now and no more, so that a flood of changes cannot hold a caller here.
    int pending = 0;
    if (!_inotify || ::ioctl(_inotify.get(), FIONREAD, &pending) != 0) return;

    bool isReplaced = false;
    bool hasMissed = false;
    alignas(inotify_event) std::array<char, bufferSize> buffer; // NOLINT(cppcoreguidelines-pro-type-member-init)
    while (pending > 0) {
        // The descriptor does not block.
        // NOLINTNEXTLINE(clang-analyzer-unix.BlockInCriticalSection)
        const ssize_t size = ::read(_inotify.get(), buffer.data(), buffer.size());
        if (size < 0 && errno == EINTR) continue;
        if (size <= 0) break;
        pending -= static_cast<int>(size);

        for (std::size_t at = 0; at < static_cast<std::size_t>(size);) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + at); // NOLINT
            at += sizeof(inotify_event) + event->len;
            const std::string_view name = event->len > 0 ? event->name : "";
            if ((event->mask & IN_Q_OVERFLOW) != 0) {
                hasMissed = true;
            } else if (event->wd == _parentWatch) {
                isReplaced = isReplaced || name == _name || (event->mask & IN_IGNORED) != 0;
            } else if (event->wd != _watch) {
                continue; // of a directory that is watched no more
            } else if ((event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) != 0) {
                isReplaced = true;
                if ((event->mask & IN_IGNORED) != 0) _watch = -1;
            } else {
                _callbacks.changed(event->mask, name);
            }
        }
    }
    if (hasMissed) _callbacks.missed();
    // After an overflow the notice of a replaced directory may be among the lost ones.
    if (isReplaced || hasMissed) watch();
}

} // namespace platform::linux_
