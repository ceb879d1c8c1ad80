#pragma once

#include "platform/RunLoop.h"
#include "platform/linux/Descriptor.h"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>

namespace platform::linux_ {

class MainQueue;

/// The main run loop on epoll: the main queue wakes it through an eventfd, signals come through signalfds. Its signals
/// stay blocked after their source is gone. A system without room for these descriptors stops the process.
class RunLoop final : public platform::RunLoop {
public:
    /// The constructing thread becomes the main thread.
    RunLoop();
    ~RunLoop() override;

    void run() override;
    /// As `run`, but returns once `isDone` answers true; asked after each round of events. For programs that end.
    void runUntil(const std::function<bool()>& isDone);

    /// On the main thread outside of `run`, its `sync` runs what is waiting and then the item, in place.
    /// `asyncOnCaller` is `async`: items are for the main thread.
    std::shared_ptr<WorkQueue> mainQueue() override;

    std::unique_ptr<platform::SignalSource> makeSignalSource(int signal, std::function<void()> handler) override;

private:
    class SignalSource;

    /// Begins to call `source` when its descriptor becomes readable.
    void add(std::uint64_t key, SignalSource& source, int descriptor);
    void remove(std::uint64_t key, int descriptor);

    Descriptor _epoll;
    std::shared_ptr<MainQueue> _mainQueue;
    // By key and not by address: an event may already be fetched when its source goes.
    std::map<std::uint64_t, SignalSource*> _sources;
    std::uint64_t _lastKey = 0;
};

} // namespace platform::linux_
