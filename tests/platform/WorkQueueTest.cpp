#include "platform/linux/WorkQueue.h"
#include "tests/support/WorkQueueFake.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <semaphore>
#include <string>
#include <thread>
#include <vector>

namespace {

using platform::QualityOfService;
using platform::WorkQueue;

/// Only a test that fails waits that long.
constexpr std::chrono::seconds deadline{30};

void expectReady(std::future<void> event) { EXPECT_EQ(event.wait_for(deadline), std::future_status::ready); }

/// The Linux queues, and how to wait until a queue has run what it was given.
struct LinuxQueues {
    platform::linux_::WorkQueues queues;
    void settle(const std::shared_ptr<WorkQueue>& queue) {
        std::promise<void> done;
        queue->async([&] { done.set_value(); });
        expectReady(done.get_future());
    }
};

template <support::FakeWorkQueues::Mode mode> struct FakeQueues {
    support::FakeWorkQueues queues{mode};
    void settle(const std::shared_ptr<WorkQueue>&) { queues.runAll(); }
};

template <class T> class WorkQueues : public testing::Test {
protected:
    std::shared_ptr<WorkQueue> make(const std::string& label) {
        return platform.queues.makeSerial(label, QualityOfService::standard);
    }
    T platform;
};

using Implementations = testing::Types<LinuxQueues, FakeQueues<support::FakeWorkQueues::Mode::manual>,
                                       FakeQueues<support::FakeWorkQueues::Mode::inPlace>>;
TYPED_TEST_SUITE(WorkQueues, Implementations);

TYPED_TEST(WorkQueues, ItemsOfAllKindsRunInTheOrderSubmitted) {
    const auto queue = this->make("order");
    int next = 0;
    for (int i = 0; i < 300; i += 3) {
        queue->async([&, i] { EXPECT_EQ(next++, i); });
        queue->asyncOnCaller([&, i] { EXPECT_EQ(next++, i + 1); });
        if (i % 5 == 0) queue->sync([&] { EXPECT_EQ(next++, i + 2); });
        if (i % 5 != 0) queue->async([&, i] { EXPECT_EQ(next++, i + 2); });
    }
    this->platform.settle(queue);
    EXPECT_EQ(next, 300);
}

TYPED_TEST(WorkQueues, ItemsSubmittedByAnItemRunAfterIt) {
    const auto queue = this->make("nested");
    std::string trace;
    queue->async([&] {
        queue->async([&] { trace += 'b'; });
        queue->asyncOnCaller([&] { trace += 'c'; });
        trace += 'a';
    });
    this->platform.settle(queue);
    queue->sync([&] {
        queue->async([&] { trace += 'e'; });
        trace += 'd';
    });
    this->platform.settle(queue);
    EXPECT_EQ(trace, "abcde");
}

TYPED_TEST(WorkQueues, QueuesAreCurrentWhileTheyRunAnItemAndInNestedOnesToo) {
    const auto outer = this->make("outer");
    const auto inner = this->make("inner");
    const auto check = [&] {
        outer->assertCurrent();
        EXPECT_FALSE(inner->isCurrent());
        inner->sync([&] {
            EXPECT_TRUE(outer->isCurrent());
            EXPECT_TRUE(inner->isCurrent());
        });
        EXPECT_FALSE(inner->isCurrent());
    };
    outer->sync(check);
    outer->async(check);
    outer->asyncOnCaller(check);
    this->platform.settle(outer);
    EXPECT_FALSE(outer->isCurrent());
}

TYPED_TEST(WorkQueues, ItemsOfADroppedQueueStillRun) {
    std::promise<void> ran;
    auto queue = this->make("dropped");
    queue->async([&ran, self = queue.get()] {
        self->assertCurrent();
        ran.set_value();
    });
    queue.reset();
    this->platform.settle(this->make("other"));
    expectReady(ran.get_future());
}

TYPED_TEST(WorkQueues, MisuseStopsTheProcessWithTheLabel) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const auto queue = this->make("the label");
    EXPECT_DEATH(queue->sync([&] { queue->sync([] {}); }), "\"the label\" is entered from itself");
    EXPECT_DEATH(queue->assertCurrent(), "not on work queue \"the label\"");
}

/// Occupies a queue until what it answers is released.
std::shared_ptr<std::binary_semaphore> block(const std::shared_ptr<WorkQueue>& queue) {
    auto release = std::make_shared<std::binary_semaphore>(0);
    auto started = std::make_shared<std::promise<void>>();
    queue->async([release, started] {
        started->set_value();
        release->acquire();
    });
    expectReady(started->get_future());
    return release;
}

class LinuxWorkQueues : public testing::Test {
protected:
    platform::linux_::WorkQueues queues;
    std::shared_ptr<WorkQueue> queue = make();
    std::shared_ptr<WorkQueue> make() { return queues.makeSerial("label", QualityOfService::standard); }
};

TEST_F(LinuxWorkQueues, BlockedQueuesDoNotHoldUpOthers) {
    std::vector<std::shared_ptr<std::binary_semaphore>> blocked;
    // Each one starts only if a thread is left for it; more than any machine's processors.
    const std::size_t count = 2 * std::thread::hardware_concurrency() + 20;
    for (std::size_t i = 0; i < count; ++i) blocked.push_back(block(make()));
    for (const auto& each : blocked) each->release();
}

TEST_F(LinuxWorkQueues, UserInitiatedQueuesGoFirstWhenThreadsAreShort) {
    std::string order;
    {
        platform::linux_::WorkQueues one(1);
        const auto standard = one.makeSerial("standard", QualityOfService::standard);
        const auto user = one.makeSerial("user", QualityOfService::userInitiated);
        const auto busy = block(one.makeSerial("busy", QualityOfService::standard));
        standard->async([&] { order += 's'; });
        user->async([&] { order += 'u'; });
        busy->release();
    } // returns when all has run
    EXPECT_EQ(order, "us");
}

TEST_F(LinuxWorkQueues, DestructionRunsWhatIsWaitingAndWhatThatSubmits) {
    std::atomic<int> runs = 0;
    {
        platform::linux_::WorkQueues ending;
        const auto first = ending.makeSerial("first", QualityOfService::standard);
        const auto second = ending.makeSerial("second", QualityOfService::standard);
        for (int i = 0; i < 1000; ++i)
            first->async([&, second] {
                ++runs;
                second->async([&] { ++runs; });
            });
    }
    EXPECT_EQ(runs, 2000);
}

TEST_F(LinuxWorkQueues, IdleQueuesRunItemsOnTheCallersThread) {
    int runs = 0;
    const auto expectOwnThread = [&, self = std::this_thread::get_id()] {
        ++runs;
        EXPECT_EQ(std::this_thread::get_id(), self);
    };
    queue->sync(expectOwnThread);
    queue->asyncOnCaller([&] {
        expectOwnThread();
        queue->async(expectOwnThread);
    });
    EXPECT_EQ(runs, 3);
}

TEST_F(LinuxWorkQueues, CallersAreNotCapturedByAnEndlessLineOfItems) {
    std::atomic<bool> isReturned = false;
    std::promise<void> ended;
    std::function<void()> item = [&] {
        if (isReturned)
            ended.set_value();
        else
            queue->async(item);
    };
    queue->asyncOnCaller(item);
    isReturned = true; // never reached by a caller that runs whatever comes
    expectReady(ended.get_future());
}

TEST_F(LinuxWorkQueues, ThrowingSyncItemsGiveTheQueueBack) {
    EXPECT_THROW(queue->sync([] { throw std::runtime_error("item"); }), std::runtime_error);
    EXPECT_FALSE(queue->isCurrent());
    EXPECT_EQ(*queue->sync([] { return std::make_unique<int>(1); }), 1);
}

TEST_F(LinuxWorkQueues, ManyThreadsNeverOverlapAndEachKeepsItsOrder) {
    constexpr std::size_t rounds = 3000;
    const auto nested = queues.makeSerial("nested", QualityOfService::userInitiated);
    std::array<std::size_t, 4> next{}; // no lock: the queue is one
    std::size_t nestedRuns = 0;
    std::size_t inversions = 0;
    std::vector<std::thread> threads;
    for (std::size_t thread = 0; thread < next.size(); ++thread)
        threads.emplace_back([&, thread] {
            for (std::size_t i = 0; i < rounds; ++i) {
                const auto item = [&, thread, i] {
                    if (next[thread]++ != i) ++inversions;
                    nested->sync([&] { ++nestedRuns; });
                };
                switch ((i + thread) % 3) {
                case 0: queue->async(item); break;
                case 1: queue->asyncOnCaller(item); break;
                default: queue->sync(item); break;
                }
            }
        });
    for (std::thread& thread : threads) thread.join();
    queue->sync([&] { EXPECT_EQ(inversions, 0U); });
    nested->sync([&] { EXPECT_EQ(nestedRuns, next.size() * rounds); });
}

} // namespace
