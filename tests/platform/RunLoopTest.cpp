#include "platform/linux/RunLoop.h"
#include "tests/support/RunLoopFake.h"

#include <gtest/gtest.h>

#include <csignal>
#include <thread>

namespace {

TEST(RunLoop, MainQueueItemsRunInsideRunOrBeforeASyncInOrder) {
    platform::linux_::RunLoop loop;
    const auto queue = loop.mainQueue();
    std::string trace; // the main thread's
    const auto adding = [&](char mark) {
        return [&, mark] {
            queue->assertCurrent();
            trace += mark;
        };
    };
    queue->async([&] {
        adding('a')();
        queue->async(adding('c'));
    });
    queue->asyncOnCaller(adding('b'), nullptr);
    EXPECT_EQ(trace, ""); // not before the loop runs
    loop.runUntil([&] { return trace.size() >= 3; });
    queue->async(adding('d'));
    queue->sync(adding('e'));
    EXPECT_EQ(trace, "abcde");

    const std::jthread other([&] {
        for (int i = 0; i < 1000; ++i) queue->sync(adding('f'));
        queue->async(adding('.'));
    });
    loop.runUntil([&] { return trace.ends_with('.'); });
    EXPECT_EQ(trace, "abcde" + std::string(1000, 'f') + '.');
}

/// What comes before a source is active is delivered then, and nothing after the source went.
void expectSignals(platform::RunLoop& loop, const std::function<void()>& raise, const std::function<void()>& run) {
    int calls = 0;
    auto source = loop.makeSignalSource(SIGUSR1, [&] {
        loop.mainQueue()->assertCurrent();
        ++calls;
    });
    raise();
    run();
    EXPECT_EQ(calls, 0);
    source->activate();
    for (const int expected : {1, 2}) {
        run();
        EXPECT_EQ(calls, expected);
        raise();
    }
    source.reset();
    run();
    EXPECT_EQ(calls, 2);
}

TEST(RunLoop, SignalsReachTheirSourceOnceItIsActive) {
    support::FakeWorkQueues queues(support::FakeWorkQueues::Mode::manual);
    support::FakeRunLoop twin(queues);
    expectSignals(twin, [&] { twin.raise(SIGUSR1); }, [&] { twin.run(); });

    platform::linux_::RunLoop loop;
    const auto run = [&] {
        bool hasRun = false;
        loop.mainQueue()->async([&] { hasRun = true; });
        loop.runUntil([&] { return hasRun; });
    };
    expectSignals(loop, [] { ::raise(SIGUSR1); }, run);
}

} // namespace
