#pragma once

#include "platform/RunLoop.h"
#include "tests/support/WorkQueueFake.h"

#include <functional>
#include <memory>
#include <utility>

namespace support {

/// A run loop without signals: the test raises them, and they reach their sources through the main queue.
class FakeRunLoop final : public platform::RunLoop {
public:
    /// The main queue is one of `queues`, labelled "main".
    explicit FakeRunLoop(FakeWorkQueues& queues) : _queues(queues), _mainQueue(queues.makeSerial("main")) {}

    /// Runs the items of all queues until none is left.
    void run() override {
        ++runs;
        _queues.runAll();
    }
    std::shared_ptr<platform::WorkQueue> mainQueue() override { return _mainQueue; }

    std::unique_ptr<platform::SignalSource> makeSignalSource(int signal, std::function<void()> handler) override {
        auto state = std::make_shared<State>(State{signal, std::move(handler), _mainQueue});
        _states.push_back(state);
        return std::make_unique<Source>(std::move(state));
    }

    /// As if the process got `signal`. False when no source takes it: the process would have ended.
    bool raise(int signal) {
        bool isTaken = false;
        for (const auto& weak : _states) {
            const auto state = weak.lock();
            if (!state || state->signal != signal) continue;
            isTaken = true;
            State::raise(state);
        }
        return isTaken;
    }

    /// How often `run` was called.
    int runs = 0;

private:
    struct State {
        int signal;
        std::function<void()> handler;
        std::shared_ptr<platform::WorkQueue> queue;
        bool isActive = false;
        bool isPending = false; // however often raised, as signals are

        static void raise(const std::shared_ptr<State>& state) {
            if (state->isPending) return;
            state->isPending = true;
            if (state->isActive) deliver(state);
        }
        static void deliver(const std::shared_ptr<State>& state) {
            state->queue->async([weak = std::weak_ptr<State>(state)] {
                const auto locked = weak.lock();
                if (!locked) return; // its source is gone
                locked->isPending = false;
                locked->handler();
            });
        }
    };
    class Source final : public platform::SignalSource {
    public:
        explicit Source(std::shared_ptr<State> state) : _state(std::move(state)) {}
        void activate() override {
            if (std::exchange(_state->isActive, true)) return;
            if (_state->isPending) State::deliver(_state);
        }

    private:
        std::shared_ptr<State> _state;
    };

    FakeWorkQueues& _queues;
    std::shared_ptr<platform::WorkQueue> _mainQueue;
    std::vector<std::weak_ptr<State>> _states;
};

} // namespace support
