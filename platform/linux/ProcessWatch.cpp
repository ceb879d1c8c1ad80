#include "platform/linux/ProcessWatch.h"

#include <array>
#include <cerrno>
#include <sys/epoll.h>

namespace platform::linux_ {

ProcessWatch::ProcessWatch() : _epoll(::epoll_create1(EPOLL_CLOEXEC)) {}

int ProcessWatch::add(Descriptor process, std::string name) {
    const std::lock_guard lock(_mutex);
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = _next;
    if (::epoll_ctl(_epoll.get(), EPOLL_CTL_ADD, process.get(), &event) != 0) return errno;
    _watched.emplace(_next++, Watched{std::move(process), std::move(name)});
    return 0;
}

std::vector<std::string> ProcessWatch::takeEnded() {
    std::array<epoll_event, 64> events;
    const std::lock_guard lock(_mutex);
    std::vector<std::string> names;
    const int count = ::epoll_wait(_epoll.get(), events.data(), static_cast<int>(events.size()), 0);
    for (int index = 0; index < count; ++index) {
        auto ended = _watched.extract(events[static_cast<std::size_t>(index)].data.u64);
        if (ended.empty()) continue;
        names.push_back(std::move(ended.mapped().name));
        // Said explicitly, since a descriptor that somebody else shares would stay in the set.
        ::epoll_ctl(_epoll.get(), EPOLL_CTL_DEL, ended.mapped().process.get(), nullptr);
    }
    return names;
}

} // namespace platform::linux_
