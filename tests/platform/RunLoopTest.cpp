#include "platform/linux/RunLoop.h"
#include "tests/support/RunLoopFake.h"

#include <gtest/gtest.h>

#include <csignal>
#include <ctime>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <unistd.h>

namespace {

struct LinuxRunLoop {
    LinuxRunLoop() { ::alarm(30); } // ends a test that would hang
    ~LinuxRunLoop() {
        ::alarm(0);
        for (const int signal : {SIGUSR1, SIGUSR2}) ::signal(signal, SIG_IGN); // drops what nobody took
        for (const int signal : {SIGUSR1, SIGUSR2}) ::signal(signal, SIG_DFL);
    }
    platform::linux_::RunLoop loop;
    void raise(int signal) { ASSERT_EQ(::kill(::getpid(), signal), 0); }
    void runUntil(const std::string& trace, const std::string& expected) {
        loop.runUntil([&] { return trace.size() >= expected.size(); });
        EXPECT_EQ(trace, expected);
    }
};

struct TwinRunLoop {
    support::FakeWorkQueues queues;
    support::FakeRunLoop loop{queues};
    void raise(int signal) { loop.raise(signal); }
    void runUntil(const std::string& trace, const std::string& expected) {
        loop.run();
        EXPECT_EQ(trace, expected);
    }
};

template <class T> class RunLoops : public testing::Test {
protected:
    T platform;
    std::string trace;
};

using Implementations = testing::Types<LinuxRunLoop, TwinRunLoop>;
TYPED_TEST_SUITE(RunLoops, Implementations);

TYPED_TEST(RunLoops, MainQueueItemsRunInsideRunInOrder) {
    const auto queue = this->platform.loop.mainQueue();
    const auto self = std::this_thread::get_id();
    queue->async([&] {
        EXPECT_EQ(std::this_thread::get_id(), self);
        queue->assertCurrent();
        this->trace += 'a';
        queue->async([&] { this->trace += 'c'; });
    });
    queue->asyncOnCaller([&] { this->trace += 'b'; });
    EXPECT_EQ(this->trace, ""); // not before the loop runs
    EXPECT_FALSE(queue->isCurrent());
    this->platform.runUntil(this->trace, "abc");
}

TYPED_TEST(RunLoops, SyncOnTheMainThreadOutsideOfRunRunsWhatIsWaitingFirst) {
    const auto queue = this->platform.loop.mainQueue();
    queue->async([&] { this->trace += 'a'; });
    queue->sync([&] {
        EXPECT_TRUE(queue->isCurrent());
        this->trace += 'b';
    });
    EXPECT_EQ(this->trace, "ab");
}

TYPED_TEST(RunLoops, SignalsReachActiveSourcesOnTheMainQueue) {
    const auto queue = this->platform.loop.mainQueue();
    const auto source = this->platform.loop.makeSignalSource(SIGUSR1, [&] {
        queue->assertCurrent();
        this->trace += 's';
    });
    this->platform.raise(SIGUSR1); // waits for the activation
    queue->async([&] { this->trace += 'a'; });
    this->platform.runUntil(this->trace, "a");
    source->activate();
    source->activate();
    this->platform.runUntil(this->trace, "as");
    this->platform.raise(SIGUSR1);
    this->platform.runUntil(this->trace, "ass");
}

TYPED_TEST(RunLoops, DestroyedSourcesAreSilentAlsoWhenTheyEndThemselves) {
    std::unique_ptr<platform::SignalSource> first;
    const std::shared_ptr<int> kept = std::make_shared<int>(0);
    first = this->platform.loop.makeSignalSource(SIGUSR1, [&, copy = kept] {
        first.reset();
        this->trace += copy ? '1' : '?'; // what the handler holds outlives its source
    });
    auto second = this->platform.loop.makeSignalSource(SIGUSR2, [&] { this->trace += '2'; });
    first->activate();
    second->activate();
    this->platform.raise(SIGUSR1);
    this->platform.runUntil(this->trace, "1");
    EXPECT_EQ(kept.use_count(), 1);

    this->platform.raise(SIGUSR1); // keeps its default action off although nobody listens
    this->platform.raise(SIGUSR2);
    second.reset();
    this->platform.loop.mainQueue()->async([&] { this->trace += 'q'; });
    this->platform.runUntil(this->trace, "1q");
}

TEST(LinuxRunLoop, OtherThreadsSubmitAndWait) {
    LinuxRunLoop platform;
    auto& loop = platform.loop;
    const auto queue = loop.mainQueue();
    const auto mainThread = std::this_thread::get_id();
    bool isDone = false; // the main thread's
    std::thread other([&] {
        for (int i = 0; i < 1000; ++i) {
            int seen = 0;
            queue->async([&] { seen += 1; });
            queue->sync([&] {
                EXPECT_EQ(std::this_thread::get_id(), mainThread);
                seen += 10;
            });
            EXPECT_EQ(seen, 11);
            EXPECT_FALSE(queue->isCurrent());
        }
        queue->async([&] { isDone = true; });
    });
    loop.runUntil([&] { return isDone; });
    other.join();
}

} // namespace
