#pragma once

#include "platform/WorkQueue.h"

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

namespace platform::linux_ {

/// One handler to be called on a queue, which can be ended at any moment. Notices that come before the handler was
/// called for an earlier one arrive as one, so a slow queue never piles them up.
class QueuedObserver : public std::enable_shared_from_this<QueuedObserver> {
public:
    QueuedObserver(std::shared_ptr<WorkQueue> queue, std::function<void()> handler);

    /// Any thread; returns at once.
    void notify();
    /// Any thread, also inside the handler. Waits for a call of the handler that runs on another thread, and none
    /// begins after it returned: so do not call it holding what the handler waits for.
    void end();

private:
    void run();

    const std::shared_ptr<WorkQueue> _queue;
    std::atomic<bool> _isPending = false;
    std::recursive_mutex _mutex; // held while the handler runs; recursive because the handler may end its observer
    std::function<void()> _handler;
    bool _isRunning = false;
    bool _isEnded = false;
};

/// The observers of one service, by what they observe. Callable from any thread.
class QueuedObservers {
public:
    std::shared_ptr<QueuedObserver> add(const std::string& name, std::shared_ptr<WorkQueue> queue,
                                        std::function<void()> handler);
    void remove(const std::shared_ptr<QueuedObserver>& observer);
    void notify(const std::string& name);
    void notifyAll();

private:
    // Notices go out without the lock, so that a queue which runs them in place may come back here.
    std::mutex _mutex;
    std::multimap<std::string, std::shared_ptr<QueuedObserver>, std::less<>> _observers;
};

/// The handle that a service gives out for one observer; it may outlive the service.
template <class Handle> class QueuedObservation final : public Handle {
public:
    QueuedObservation(std::shared_ptr<QueuedObservers> observers, std::shared_ptr<QueuedObserver> observer)
        : _observers(std::move(observers)), _observer(std::move(observer)) {}
    ~QueuedObservation() override {
        _observers->remove(_observer);
        _observer->end();
    }

private:
    const std::shared_ptr<QueuedObservers> _observers;
    const std::shared_ptr<QueuedObserver> _observer;
};

} // namespace platform::linux_
