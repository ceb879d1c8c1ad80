#pragma once

#include "platform/WorkQueue.h"

#include <functional>
#include <memory>

namespace platform {

/// Turns one signal into calls of its handler on the main queue. Ends when destroyed.
class SignalSource {
public:
    virtual ~SignalSource() = default;
    /// Begins delivery. A signal that came after the source was made is delivered now.
    virtual void activate() = 0;
};

/// The main thread's loop. Made on the main thread before any other thread exists, so that every thread inherits the
/// blocked signals.
class RunLoop {
public:
    virtual ~RunLoop() = default;

    /// Serves the main queue and the signal sources on the calling thread. Does not return while the process lives
    /// (the in-memory twin returns when it has nothing left to do).
    virtual void run() = 0;

    /// Items run on the thread inside `run`.
    virtual std::shared_ptr<WorkQueue> mainQueue() = 0;

    /// From now on `signal` no longer has its default action. Main thread only.
    virtual std::unique_ptr<SignalSource> makeSignalSource(int signal, std::function<void()> handler) = 0;
};

} // namespace platform
