#pragma once

#include "platform/RunLoop.h"
#include "tests/support/WorkQueueFake.h"

namespace support {

/// A run loop that ends when nothing is left to do. The test raises its signals.
class FakeRunLoop final : public platform::RunLoop {
public:
    /// The main queue is one of `queues`, labelled "main".
    explicit FakeRunLoop(FakeWorkQueues& queues) : _queues(queues), _mainQueue(queues.makeSerial("main")) {}

    void run() override { _queues.runAll(); }
    std::shared_ptr<platform::WorkQueue> mainQueue() override { return _mainQueue; }
    std::unique_ptr<platform::SignalSource> makeSignalSource(int signal, std::function<void()> handler) override {
        auto state = std::make_shared<State>(State{signal, std::move(handler), _mainQueue});
        _states.push_back(state);
        return std::make_unique<Source>(std::move(state));
    }
    void raise(int signal) {
        for (const auto& weak : _states) {
            const auto state = weak.lock();
            if (!state || state->signal != signal) continue;
            state->isPending = true; // however often raised, as signals are
            deliver(state);
        }
    }

private:
    struct State {
        int signal;
        std::function<void()> handler;
        std::shared_ptr<platform::WorkQueue> queue;
        bool isActive = false;
        bool isPending = false;
    };
    struct Source final : platform::SignalSource {
        explicit Source(std::shared_ptr<State> its) : state(std::move(its)) {}
        void activate() override {
            state->isActive = true;
            deliver(state);
        }
        const std::shared_ptr<State> state; // its end is the source's
    };
    static void deliver(const std::shared_ptr<State>& state) {
        if (!state->isActive || !std::exchange(state->isPending, false)) return;
        state->queue->async([weak = std::weak_ptr(state)] {
            if (const auto source = weak.lock()) source->handler();
        });
    }

    FakeWorkQueues& _queues;
    std::shared_ptr<platform::WorkQueue> _mainQueue;
    std::vector<std::weak_ptr<State>> _states;
};

} // namespace support
