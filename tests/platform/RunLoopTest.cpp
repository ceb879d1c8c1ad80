#include "platform/linux/RunLoop.h"

#include <gtest/gtest.h>

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

} // namespace
