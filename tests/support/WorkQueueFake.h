#pragma once

#include "platform/WorkQueue.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <vector>

namespace support {

/// Queues without threads: items wait, in one line for all queues, until the test runs them on its own thread.
class FakeWorkQueues final : public platform::WorkQueues {
    using WorkQueue = platform::WorkQueue;

public:
    enum class Mode {
        manual,  // items run in `runOne`, `runAll`, or before a `sync` of their queue
        inPlace, // items run when submitted, or after the item of the same queue that is running
    };

    explicit FakeWorkQueues(Mode mode = Mode::manual) { setMode(mode); }
    void setMode(Mode mode) { _line->mode = mode; }

    struct Made {
        std::string label;
    };
    /// Every queue made so far.
    std::vector<Made> made;

    std::shared_ptr<WorkQueue> makeSerial(std::string label, platform::QualityOfService = {}) override {
        made.push_back({label});
        return std::make_shared<Queue>(std::move(label), _line);
    }

    /// Runs the oldest item that may run now. False when there is none.
    bool runOne() { return _line->runFirst(nullptr); }
    /// Runs items until none is left, those submitted meanwhile too.
    void runAll() {
        while (runOne()) {
        }
    }

private:
    class Queue;
    struct Line {
        Mode mode = Mode::manual;
        std::deque<std::pair<std::shared_ptr<Queue>, WorkQueue::Item>> items; // a queue lives until its own ran

        /// Of `queue`, or of any when null.
        bool runFirst(const Queue* queue) {
            const auto next = std::ranges::find_if(items, [queue](const auto& each) {
                return !each.first->isCurrent() && (!queue || each.first.get() == queue);
            });
            if (next == items.end()) return false;
            const auto [its, item] = std::move(*next);
            items.erase(next);
            its->run(item);
            return true;
        }
    };

    class Queue final : public WorkQueue, public std::enable_shared_from_this<Queue> {
    public:
        Queue(std::string label, std::shared_ptr<Line> line) : _label(std::move(label)), _line(std::move(line)) {}

        void async(Item item) override {
            _line->items.emplace_back(shared_from_this(), std::move(item));
            if (_line->mode == Mode::inPlace) runWaiting();
        }
        void asyncOnCaller(Item item, std::function<bool()> /*isBrief*/) override { async(std::move(item)); }
        bool isCurrent() const override { return _isRunning; }
        std::string_view label() const override { return _label; }

        void run(const Item& item) {
            _isRunning = true;
            item();
            _isRunning = false;
        }

    private:
        void runSync(Call call) override {
            if (_isRunning) {
                std::fprintf(stderr, "work queue \"%s\" is entered from itself\n", _label.c_str());
                std::abort();
            }
            runWaiting();
            run([&] { call.invoke(call.context); });
            if (_line->mode == Mode::inPlace) runWaiting();
        }
        void runWaiting() {
            while (_line->runFirst(this)) {
            }
        }

        const std::string _label;
        const std::shared_ptr<Line> _line;
        bool _isRunning = false;
    };

    const std::shared_ptr<Line> _line = std::make_shared<Line>();
};

} // namespace support
