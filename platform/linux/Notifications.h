#pragma once

#include "platform/Notifications.h"
#include "platform/linux/DirectoryWatcher.h"
#include "platform/linux/QueuedObservers.h"
#include "platform/linux/Root.h"

#include <string>

namespace platform::linux_ {

/// Notifications as files: `<root>/run/nordane/notifications/<name>` holds a 64-bit counter in the machine's byte
/// order, which each post raises, and observers watch the directory. Every user may post and observe. A user for whom
/// the counter belongs to somebody else posts by making and removing a file `<name>@<random>` instead. Callable from
/// any thread; the thread that hears of posts begins with the first observer.
///
/// Names that cannot be part of a file name, or hold "@", are posted nowhere and never heard. An observer may be called
/// without a post when posts may have been lost.
class Notifications final : public platform::Notifications {
public:
    explicit Notifications(const Root& root);

    void post(const std::string& name) override;
    std::unique_ptr<NotificationObservation> observe(const std::string& name, std::shared_ptr<WorkQueue> queue,
                                                     std::function<void()> handler) override;

private:
    void makeDirectory() const;

    const std::string _directory;
    const std::shared_ptr<QueuedObservers> _observers = std::make_shared<QueuedObservers>();
    DirectoryWatcher _watcher; // last, so that its thread ends first
};

} // namespace platform::linux_
