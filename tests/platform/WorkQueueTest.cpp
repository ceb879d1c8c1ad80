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

struct ManualQueues {
    support::FakeWorkQueues queues;
    void settle(const std::shared_ptr<WorkQueue>&) { queues.runAll(); }
};

struct InPlaceQueues {
    support::FakeWorkQueues queues{support::FakeWorkQueues::Mode::inPlace};
    void settle(const std::shared_ptr<WorkQueue>&) {}
};

template <class T> class WorkQueues : public testing::Test {
protected:
    std::shared_ptr<WorkQueue> make(const std::string& label) {
        return platform.queues.makeSerial(label, QualityOfService::standard);
    }
    T platform;
};

using Implementations = testing::Types<LinuxQueues, ManualQueues, InPlaceQueues>;
TYPED_TEST_SUITE(WorkQueues, Implementations);

TYPED_TEST(WorkQueues, ItemsOfAllKindsRunInTheOrderSubmitted) {
    const auto queue = this->make("order");
    std::vector<int> order;
    for (int i = 0; i < 300; i += 3) {
        queue->async([&, i] { order.push_back(i); });
        queue->asyncOnCaller([&, i] { order.push_back(i + 1); });
        if (i % 5 == 0)
            queue->sync([&] { order.push_back(i + 2); });
        else
            queue->async([&, i] { order.push_back(i + 2); });
    }
    this->platform.settle(queue);
    ASSERT_EQ(order.size(), 300U);
    for (int i = 0; i < 300; ++i) EXPECT_EQ(order[static_cast<std::size_t>(i)], i);
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
    queue->sync([&] { queue->async([&] { trace += 'e'; }), trace += 'd'; });
    this->platform.settle(queue);
    EXPECT_EQ(trace, "abcde");
}

TYPED_TEST(WorkQueues, SyncReturnsTheResultOfItsItemMovedOut) {
    const auto queue = this->make("result");
    const std::unique_ptr<int> result = queue->sync([] { return std::make_unique<int>(7); });
    EXPECT_EQ(*result, 7);
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
    std::promise<std::string> label;
    auto queue = this->make("dropped");
    queue->async([&label, self = queue.get()] { label.set_value(std::string(self->label())); });
    queue.reset();
    if constexpr (!std::is_same_v<TypeParam, LinuxQueues>) this->platform.queues.runAll();
    std::future<std::string> result = label.get_future();
    ASSERT_EQ(result.wait_for(deadline), std::future_status::ready);
    EXPECT_EQ(result.get(), "dropped");
}

TYPED_TEST(WorkQueues, MisuseStopsTheProcessWithTheLabel) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const auto queue = this->make("the label");
    EXPECT_DEATH(queue->sync([&] { queue->sync([] {}); }), "\"the label\" is entered from itself");
    EXPECT_DEATH(queue->assertCurrent(), "not on work queue \"the label\"");
}

/// Occupies a queue until released.
class Blocked {
public:
    explicit Blocked(std::shared_ptr<WorkQueue> queue) : _queue(std::move(queue)) {
        std::promise<void> started;
        _queue->async([&started, this] {
            started.set_value();
            _release.acquire();
            _released.set_value();
        });
        expectReady(started.get_future());
    }
    /// Waits until the item has used this object for the last time.
    void release() {
        _release.release();
        expectReady(_released.get_future());
        _queue->sync([] {});
    }

private:
    std::shared_ptr<WorkQueue> _queue;
    std::binary_semaphore _release{0};
    std::promise<void> _released;
};

TEST(LinuxWorkQueues, BlockedQueuesDoNotHoldUpOthers) {
    platform::linux_::WorkQueues queues;
    std::vector<std::unique_ptr<Blocked>> blocked;
    // Each one starts only if a thread is left for it; more than any machine's processors.
    const std::size_t count = 2 * std::thread::hardware_concurrency() + 20;
    for (std::size_t i = 0; i < count; ++i)
        blocked.push_back(std::make_unique<Blocked>(queues.makeSerial("blocked", QualityOfService::standard)));
    for (const auto& each : blocked) each->release();
}

TEST(LinuxWorkQueues, UserInitiatedQueuesGoFirstWhenThreadsAreShort) {
    std::string order;
    {
        platform::linux_::WorkQueues queues(1);
        const auto busy = queues.makeSerial("busy", QualityOfService::standard);
        const auto standard = queues.makeSerial("standard", QualityOfService::standard);
        const auto user = queues.makeSerial("user", QualityOfService::userInitiated);
        Blocked only(busy);
        standard->async([&] { order += 's'; });
        user->async([&] { order += 'u'; });
        only.release();
    } // returns when all has run
    EXPECT_EQ(order, "us");
}

TEST(LinuxWorkQueues, DestructionRunsWhatIsWaitingAndWhatThatSubmits) {
    std::atomic<int> runs = 0;
    {
        platform::linux_::WorkQueues queues;
        const auto first = queues.makeSerial("first", QualityOfService::standard);
        const auto second = queues.makeSerial("second", QualityOfService::standard);
        for (int i = 0; i < 1000; ++i)
            first->async([&, second] {
                ++runs;
                second->async([&] { ++runs; });
            });
    }
    EXPECT_EQ(runs, 2000);
}

TEST(LinuxWorkQueues, SyncOnABusyQueueWaitsItsTurnAndRunsOnItsOwnThread) {
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("busy", QualityOfService::standard);
    Blocked blocked(queue);
    std::string order;
    queue->async([&] { order += 'a'; });
    std::promise<void> isAsking;
    std::thread caller([&] {
        isAsking.set_value();
        const auto self = std::this_thread::get_id();
        queue->sync([&] {
            order += 's';
            EXPECT_EQ(std::this_thread::get_id(), self);
        });
    });
    expectReady(isAsking.get_future());
    blocked.release();
    caller.join();
    queue->sync([&] { EXPECT_EQ(order, "as"); });
}

TEST(LinuxWorkQueues, IdleQueuesRunItemsOnTheCallersThread) {
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("idle", QualityOfService::standard);
    std::thread::id sync;
    std::thread::id onCaller;
    std::thread::id following;
    queue->sync([&] { sync = std::this_thread::get_id(); });
    queue->asyncOnCaller([&] {
        onCaller = std::this_thread::get_id();
        queue->async([&] { following = std::this_thread::get_id(); });
    });
    EXPECT_EQ(sync, std::this_thread::get_id());
    EXPECT_EQ(onCaller, std::this_thread::get_id());
    EXPECT_EQ(following, std::this_thread::get_id());
}

TEST(LinuxWorkQueues, CallersAreNotCapturedByAnEndlessLineOfItems) {
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("endless", QualityOfService::standard);
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

TEST(LinuxWorkQueues, ThrowingSyncItemsGiveTheQueueBack) {
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("throwing", QualityOfService::standard);
    EXPECT_THROW(queue->sync([] { throw std::runtime_error("item"); }), std::runtime_error);
    EXPECT_FALSE(queue->isCurrent());
    EXPECT_EQ(queue->sync([] { return 1; }), 1);
}

TEST(LinuxWorkQueues, ManyThreadsNeverOverlapAndEachKeepsItsOrder) {
    constexpr std::size_t threadCount = 4;
    constexpr std::size_t rounds = 3000;
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("shared", QualityOfService::standard);
    const auto nested = queues.makeSerial("nested", QualityOfService::userInitiated);
    std::array<std::size_t, threadCount> next{}; // no lock: the queue is one
    std::size_t nestedRuns = 0;
    std::size_t inversions = 0;
    std::vector<std::thread> threads;
    for (std::size_t thread = 0; thread < threadCount; ++thread)
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
    queue->sync([&] {
        for (const std::size_t count : next) EXPECT_EQ(count, rounds);
        EXPECT_EQ(inversions, 0U);
    });
    nested->sync([&] { EXPECT_EQ(nestedRuns, threadCount * rounds); });
}

} // namespace
