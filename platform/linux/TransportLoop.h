#pragma once

#include "platform/linux/Descriptor.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <span>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

namespace platform::linux_ {
class LentThread;
}

namespace platform::linux_::qmx {

/// What the loop calls. All of it runs on the loop's thread, except `shutDown`.
class Pollable {
public:
    virtual ~Pollable() = default;
    /// `events` as epoll names them. Level-triggered: what is not dealt with comes again at once.
    virtual void onEvents(std::uint32_t events) = 0;
    /// A turn that was asked for with `Loop::again`.
    virtual void onTurn() {}
    /// What was delivered before `Loop::whenServed` has been served, as far as this thread serves it.
    virtual void onServed() {}
    /// The time that `Loop::expire` gave has passed.
    virtual void onDeadline() {}
    /// The transport is going away and the thread has ended: let go of everything, call no handler.
    virtual void shutDown() = 0;

private:
    friend class Loop;
    bool _kept = false;
    std::optional<std::chrono::steady_clock::time_point> _deadline;
};

/// The one I/O thread of a transport: an epoll set, tasks from other threads, deadlines, a few timers.
class Loop {
public:
    using Task = std::function<void()>;

    Loop();
    ~Loop();
    Loop(const Loop&) = delete;
    Loop& operator=(const Loop&) = delete;

    /// Ends the thread, drops tasks and shuts down all that is kept. Once; not on the thread itself.
    void stop();
    bool isCurrent() const { return std::this_thread::get_id() == _threadId.load(std::memory_order_relaxed); }

    /// True from the beginning of `stop`: no handler is to be called any more.
    bool isStopped() const { return _stopping; }

    /// Runs `task` soon on the loop's thread, never inside this call. From any thread. Dropped after `stop`.
    void post(Task task);

    // From here on, on the loop's thread only.

    /// Keeps `pollable` alive until `drop`, and to the end of the round of events even then.
    void keep(std::shared_ptr<Pollable> pollable);
    void drop(Pollable* pollable);
    /// `pollable` must be kept. False when the kernel takes no more.
    bool watch(int descriptor, std::uint32_t events, Pollable* pollable);
    void unwatch(int descriptor);
    /// Asks for another turn after the others had theirs. `pollable` must be kept.
    void again(Pollable* pollable) { _again.push_back(pollable); }
    /// Calls its `onServed` once, after the queues that this thread is lent to had theirs.
    void whenServed(Pollable* pollable) { _served.push_back(pollable); }
    void after(std::chrono::milliseconds delay, Task task);
    /// Gives `pollable` this long until it is dropped. `pollable` must be kept and have no deadline yet.
    void expire(Pollable* pollable, std::chrono::milliseconds delay);
    /// For bytes that are used up before the next call of anything.
    std::span<char> scratch() { return _scratch; }

    /// Changes the events of a watched descriptor. From any thread, while its owner makes sure that it stays open.
    void rewatch(int descriptor, std::uint32_t events, Pollable* pollable);

private:
    using Clock = std::chrono::steady_clock;

    void run();
    void runTasks();
    void runTimers();
    void runDeadlines();
    void serve(LentThread& lent);
    int timeout();

    Descriptor _epoll;
    Descriptor _wakeUp;
    std::atomic<std::thread::id> _threadId;
    std::optional<std::thread> _thread;

    std::mutex _mutex;
    std::vector<Task> _tasks;            // guarded by _mutex
    std::atomic<bool> _hasTasks = false; // changed under _mutex
    bool _ended = false;                 // guarded by _mutex: nothing is posted any more
    std::atomic<bool> _stopping = false;

    std::unordered_map<Pollable*, std::shared_ptr<Pollable>> _kept;
    std::vector<std::shared_ptr<Pollable>> _dropped; // still named by events of this round
    std::vector<Pollable*> _again;
    std::vector<Pollable*> _served;                          // to be told so
    std::vector<std::pair<Clock::time_point, Task>> _timers; // a handful: retries only
    std::set<std::pair<Clock::time_point, Pollable*>> _deadlines;
    std::vector<char> _scratch;
};

} // namespace platform::linux_::qmx
