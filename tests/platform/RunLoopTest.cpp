#include "platform/linux/RunLoop.h"

#include <gtest/gtest.h>

#include <csignal>
#include <thread>
#include <unistd.h>

namespace {

class RunLoop : public testing::Test {
protected:
    RunLoop() { ::alarm(30); } // ends a test that would hang
    ~RunLoop() override {
        ::alarm(0);
        for (const auto action : {SIG_IGN, SIG_DFL}) { // the first drops what nobody took
            for (const int number : {SIGUSR1, SIGUSR2}) ::signal(number, action);
        }
    }
    std::function<void()> adding(char mark) {
        return [this, mark] {
            queue->assertCurrent();
            trace += mark;
        };
    }
    void runUntil(const std::string& expected) {
        loop.runUntil([&] { return trace.size() >= expected.size(); });
        EXPECT_EQ(trace, expected);
    }

    platform::linux_::RunLoop loop;
    const std::shared_ptr<platform::WorkQueue> queue = loop.mainQueue();
    std::string trace; // the main thread's
};

TEST_F(RunLoop, MainQueueItemsRunInsideRunOrBeforeASyncInOrder) {
    queue->async([&] {
        adding('a')();
        queue->async(adding('c'));
    });
    queue->asyncOnCaller(adding('b'));
    EXPECT_EQ(trace, ""); // not before the loop runs
    EXPECT_FALSE(queue->isCurrent());
    runUntil("abc");
    queue->async(adding('d'));
    queue->sync(adding('e'));
    EXPECT_EQ(trace, "abcde");

    std::thread other([&] {
        for (int i = 0; i < 1000; ++i) {
            queue->async(adding('f'));
            queue->sync(adding('g'));
            EXPECT_TRUE(trace.ends_with("fg")); // the main thread waits for the next
            EXPECT_FALSE(queue->isCurrent());
        }
        queue->async(adding('.'));
    });
    loop.runUntil([&] { return trace.ends_with('.'); });
    other.join();
}

TEST_F(RunLoop, SignalsReachActiveSourcesOnTheMainQueue) {
    auto source = loop.makeSignalSource(SIGUSR1, adding('s'));
    ::kill(::getpid(), SIGUSR1); // waits for the activation
    queue->async(adding('a'));
    runUntil("a");
    source->activate();
    source->activate();
    runUntil("as");
    ::kill(::getpid(), SIGUSR1);
    runUntil("ass");
    ::kill(::getpid(), SIGUSR1); // nobody takes it, but its default action stays off
    source.reset();
    // A source may end itself, and what its handler holds outlives it.
    source = loop.makeSignalSource(SIGUSR2, [&, kept = std::make_shared<char>('2')] {
        source.reset();
        trace += *kept;
    });
    source->activate();
    ::kill(::getpid(), SIGUSR2);
    runUntil("ass2");
    ::kill(::getpid(), SIGUSR2);
    queue->async(adding('q'));
    runUntil("ass2q");
}

} // namespace
