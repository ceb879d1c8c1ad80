#pragma once

#include "platform/WorkQueue.h"

#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace support {

/// Queues without threads: items wait, in one line for all queues, until the test runs them on its own thread.
class FakeWorkQueues final : public platform::WorkQueues {
public:
    enum class Mode {
        manual,  // items run in `runOne`, `runAll`, or before a `sync` of their queue
        inPlace, // items run when submitted, or after the item of the same queue that is running
    };

    explicit FakeWorkQueues(Mode mode = Mode::manual) : _line(std::make_shared<Line>()) { _line->mode = mode; }

    struct Made {
        std::string label;
        platform::QualityOfService quality;
    };
    /// Every queue made so far.
    std::vector<Made> made;

    void setMode(Mode mode) { _line->mode = mode; }

    std::shared_ptr<platform::WorkQueue>
    makeSerial(std::string label, platform::QualityOfService quality = platform::QualityOfService::standard) override {
        made.push_back({label, quality});
        return std::make_shared<Queue>(std::move(label), _line);
    }

    /// Runs the oldest item that may run now. False when there is none.
    bool runOne() { return _line->runFirst(nullptr); }
    /// Runs items until none is left, those submitted meanwhile too. Answers how many.
    std::size_t runAll() {
        std::size_t count = 0;
        while (runOne()) ++count;
        return count;
    }
    std::size_t waiting() const { return _line->items.size(); }

private:
    class Queue;
    struct Waiting {
        std::shared_ptr<Queue> queue; // lives until its items have run
        platform::WorkQueue::Item item;
    };
    struct Line {
        Mode mode = Mode::manual;
        std::deque<Waiting> items;

        /// Of `queue`, or of any when null.
        bool runFirst(const Queue* queue);
    };

    class Queue final : public platform::WorkQueue, public std::enable_shared_from_this<Queue> {
    public:
        Queue(std::string label, std::shared_ptr<Line> line) : _label(std::move(label)), _line(std::move(line)) {}

        void async(Item item) override {
            _line->items.push_back({shared_from_this(), std::move(item)});
            if (_line->mode == Mode::inPlace) runWaiting();
        }
        void asyncOnCaller(Item item) override { async(std::move(item)); }
        bool isCurrent() const override { return _isRunning; }
        std::string_view label() const override { return _label; }

        template <class F> void runNow(F& item) {
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
            auto item = [&] { call.invoke(call.context); };
            runNow(item);
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

    std::shared_ptr<Line> _line;
};

inline bool FakeWorkQueues::Line::runFirst(const Queue* queue) {
    for (auto candidate = items.begin(); candidate != items.end(); ++candidate) {
        if (candidate->queue->isCurrent() || (queue && candidate->queue.get() != queue)) continue;
        Waiting next = std::move(*candidate);
        items.erase(candidate);
        next.queue->runNow(next.item);
        return true;
    }
    return false;
}

} // namespace support
