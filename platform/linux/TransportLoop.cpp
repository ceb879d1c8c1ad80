#include "platform/linux/TransportLoop.h"

#include "platform/linux/ServiceThread.h"
#include "platform/linux/TransportLimits.h"
#include "platform/linux/WorkQueue.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <sys/epoll.h>
#include <sys/eventfd.h>

namespace platform::linux_::qmx {

Loop::Loop()
    : _epoll(::epoll_create1(EPOLL_CLOEXEC)), _wakeUp(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)), _scratch(readSize) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.ptr = nullptr;
    const bool ready = _epoll && _wakeUp && ::epoll_ctl(_epoll.get(), EPOLL_CTL_ADD, _wakeUp.get(), &event) == 0;
    if (ready) _thread = startServiceThread("qmx-io", [this] { run(); });
    if (!_thread) {
        // Without its transport a process has nothing to do, and no caller could do better.
        std::fputs("qmx: cannot start the I/O thread\n", stderr);
        std::abort();
    }
}

Loop::~Loop() { stop(); }

void Loop::stop() {
    if (!_thread) return;
    _stopping = true;
    post([] {});
    _thread->join();
    _thread.reset();
    std::vector<Task> tasks;
    {
        const std::lock_guard lock(_mutex);
        _ended = true;
        tasks.swap(_tasks);
    }
    const auto kept = std::exchange(_kept, {});
    for (const auto& [pointer, pollable] : kept) pollable->shutDown();
    _timers.clear();
    _deadlines.clear();
    _dropped.clear();
}

void Loop::post(Task task) {
    const std::lock_guard lock(_mutex);
    if (_ended) return;
    _tasks.push_back(std::move(task));
    if (!_hasTasks.exchange(true) && !isCurrent()) {
        const std::uint64_t one = 1;
        // Fails only when the counter is full, and then the thread wakes anyway.
        [[maybe_unused]] const auto written = ::write(_wakeUp.get(), &one, sizeof one);
    }
}

void Loop::keep(std::shared_ptr<Pollable> pollable) {
    pollable->_kept = true;
    Pollable* const key = pollable.get();
    _kept.emplace(key, std::move(pollable));
}

void Loop::drop(Pollable* pollable) {
    const auto found = _kept.find(pollable);
    if (found == _kept.end()) return;
    pollable->_kept = false;
    if (pollable->_deadline) _deadlines.erase({*pollable->_deadline, pollable});
    std::erase(_again, pollable);
    _dropped.push_back(std::move(found->second));
    _kept.erase(found);
}

bool Loop::watch(int descriptor, std::uint32_t events, Pollable* pollable) {
    epoll_event event{};
    event.events = events;
    event.data.ptr = pollable;
    return ::epoll_ctl(_epoll.get(), EPOLL_CTL_ADD, descriptor, &event) == 0;
}

void Loop::unwatch(int descriptor) { ::epoll_ctl(_epoll.get(), EPOLL_CTL_DEL, descriptor, nullptr); }

void Loop::rewatch(int descriptor, std::uint32_t events, Pollable* pollable) {
    epoll_event event{};
    event.events = events;
    event.data.ptr = pollable;
    ::epoll_ctl(_epoll.get(), EPOLL_CTL_MOD, descriptor, &event);
}

void Loop::after(std::chrono::milliseconds delay, Task task) {
    _timers.emplace_back(Clock::now() + delay, std::move(task));
}

void Loop::expire(Pollable* pollable, std::chrono::milliseconds delay) {
    pollable->_deadline = Clock::now() + delay;
    _deadlines.emplace(*pollable->_deadline, pollable);
}

int Loop::timeout() {
    if (_hasTasks || !_again.empty()) return 0;
    auto first = _deadlines.empty() ? Clock::time_point::max() : _deadlines.begin()->first;
    for (const auto& timer : _timers) first = std::min(first, timer.first);
    if (first == Clock::time_point::max()) return -1;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(first - Clock::now()).count();
    return static_cast<int>(std::clamp<std::int64_t>(left, 0, 60'000));
}

void Loop::runTasks() {
    if (!_hasTasks) return;
    std::vector<Task> tasks;
    {
        const std::lock_guard lock(_mutex);
        tasks.swap(_tasks);
        _hasTasks = false;
    }
    for (Task& task : tasks) {
        if (_stopping) return;
        task();
    }
}

void Loop::runTimers() {
    if (_timers.empty()) return;
    const auto now = Clock::now();
    const auto due =
        std::partition(_timers.begin(), _timers.end(), [now](const auto& timer) { return timer.first > now; });
    std::vector<Task> tasks;
    for (auto timer = due; timer != _timers.end(); ++timer) tasks.push_back(std::move(timer->second));
    _timers.erase(due, _timers.end());
    for (Task& task : tasks) task();
}

void Loop::runDeadlines() {
    if (_deadlines.empty()) return;
    const auto now = Clock::now();
    while (!_deadlines.empty() && _deadlines.begin()->first <= now) {
        Pollable* const pollable = _deadlines.begin()->second;
        _deadlines.erase(_deadlines.begin());
        pollable->_deadline.reset();
        pollable->onDeadline();
    }
}

void Loop::serve(LentThread& lent) {
    lent.serve();
    for (Pollable* pollable : _served) {
        if (pollable->_kept) pollable->onServed();
    }
    _served.clear();
}

void Loop::run() {
    _threadId = std::this_thread::get_id();
    std::array<epoll_event, 64> events;
    std::vector<Pollable*> turns;
    LentThread lent;
    while (!_stopping) {
        const int count = ::epoll_wait(_epoll.get(), events.data(), static_cast<int>(events.size()), timeout());
        for (int i = 0; i < count && !_stopping; ++i) {
            const epoll_event& event = events[static_cast<std::size_t>(i)];
            if (event.data.ptr == nullptr) {
                std::uint64_t ignored = 0;
                [[maybe_unused]] const auto taken = ::read(_wakeUp.get(), &ignored, sizeof ignored);
                continue;
            }
            auto* const pollable = static_cast<Pollable*>(event.data.ptr);
            if (pollable->_kept) pollable->onEvents(event.events);
            serve(lent);
        }
        runTasks();
        runTimers();
        runDeadlines();
        serve(lent);
        turns.swap(_again);
        for (Pollable* pollable : turns) {
            if (pollable->_kept && !_stopping) pollable->onTurn();
            serve(lent);
        }
        turns.clear();
        _dropped.clear();
    }
}

} // namespace platform::linux_::qmx
