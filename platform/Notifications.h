#pragma once

#include "platform/WorkQueue.h"

#include <functional>
#include <memory>
#include <string>

namespace platform {

/// Ends when destroyed.
class NotificationObservation {
public:
    virtual ~NotificationObservation() = default;
};

/// System-wide named notifications without payload. Posts that come close together may arrive as one.
class Notifications {
public:
    virtual ~Notifications() = default;
    /// Any thread; never blocks and never fails visibly.
    virtual void post(const std::string& name) = 0;
    /// Calls `handler` on `queue` after each post from any process, this one included, made after this call returned.
    virtual std::unique_ptr<NotificationObservation> observe(const std::string& name, std::shared_ptr<WorkQueue> queue,
                                                             std::function<void()> handler) = 0;
};

} // namespace platform
