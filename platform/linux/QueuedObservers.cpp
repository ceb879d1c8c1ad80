#include "platform/linux/QueuedObservers.h"

#include <utility>
#include <vector>

namespace platform::linux_ {

QueuedObserver::QueuedObserver(std::shared_ptr<WorkQueue> queue, std::function<void()> handler)
    : _queue(std::move(queue)), _handler(std::move(handler)) {}

void QueuedObserver::notify() {
    if (_isPending.exchange(true)) return;
    _queue->async([self = shared_from_this()] { self->run(); });
}

void QueuedObserver::run() {
    const std::lock_guard lock(_mutex);
    _isPending = false; // before the call: what comes during it needs another one
    if (_isEnded) return;
    _isRunning = true;
    _handler();
    _isRunning = false;
    if (_isEnded) _handler = nullptr;
}

void QueuedObserver::end() {
    const std::lock_guard lock(_mutex);
    _isEnded = true;
    if (!_isRunning) _handler = nullptr; // a running one must not be destroyed under its own feet
}

std::shared_ptr<QueuedObserver> QueuedObservers::add(const std::string& name, std::shared_ptr<WorkQueue> queue,
                                                     std::function<void()> handler) {
    auto observer = std::make_shared<QueuedObserver>(std::move(queue), std::move(handler));
    const std::lock_guard lock(_mutex);
    _observers.emplace(name, observer);
    return observer;
}

void QueuedObservers::remove(const std::shared_ptr<QueuedObserver>& observer) {
    const std::lock_guard lock(_mutex);
    std::erase_if(_observers, [&](const auto& entry) { return entry.second == observer; });
}

void QueuedObservers::notify(const std::string& name) {
    std::vector<std::shared_ptr<QueuedObserver>> observers;
    {
        const std::lock_guard lock(_mutex);
        const auto [begin, end] = _observers.equal_range(name);
        for (auto entry = begin; entry != end; ++entry) observers.push_back(entry->second);
    }
    for (const auto& observer : observers) observer->notify();
}

void QueuedObservers::notifyAll() {
    std::vector<std::shared_ptr<QueuedObserver>> observers;
    {
        const std::lock_guard lock(_mutex);
        for (const auto& [name, observer] : _observers) observers.push_back(observer);
    }
    for (const auto& observer : observers) observer->notify();
}

} // namespace platform::linux_
