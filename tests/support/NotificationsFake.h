#pragma once

#include "platform/Notifications.h"
#include "platform/linux/QueuedObservers.h"

#include <vector>

namespace support {

/// Notifications within the process. Callable from any thread.
class FakeNotifications final : public platform::Notifications {
public:
    /// Every name posted.
    std::vector<std::string> posts() const {
        const std::lock_guard lock(_mutex);
        return _posts;
    }

    void post(const std::string& name) override {
        {
            const std::lock_guard lock(_mutex);
            _posts.push_back(name);
        }
        _observers->notify(name);
    }
    std::unique_ptr<platform::NotificationObservation> observe(const std::string& name,
                                                               std::shared_ptr<platform::WorkQueue> queue,
                                                               std::function<void()> handler) override {
        return std::make_unique<platform::linux_::QueuedObservation<platform::NotificationObservation>>(
            _observers, _observers->add(name, std::move(queue), std::move(handler)));
    }

private:
    const std::shared_ptr<platform::linux_::QueuedObservers> _observers =
        std::make_shared<platform::linux_::QueuedObservers>();
    mutable std::mutex _mutex;
    std::vector<std::string> _posts;
};

} // namespace support
