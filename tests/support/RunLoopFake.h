#pragma once

#include "platform/RunLoop.h"
#include "tests/support/WorkQueueFake.h"

namespace support {

/// A run loop that ends when nothing is left to do. No signal ever comes.
class FakeRunLoop final : public platform::RunLoop {
public:
    /// The main queue is one of `queues`, labelled "main".
    explicit FakeRunLoop(FakeWorkQueues& queues) : _queues(queues), _mainQueue(queues.makeSerial("main")) {}

    void run() override { _queues.runAll(); }
    std::shared_ptr<platform::WorkQueue> mainQueue() override { return _mainQueue; }
    std::unique_ptr<platform::SignalSource> makeSignalSource(int, std::function<void()>) override { return nullptr; }

private:
    FakeWorkQueues& _queues;
    std::shared_ptr<platform::WorkQueue> _mainQueue;
};

} // namespace support
