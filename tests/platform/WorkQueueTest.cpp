#include "platform/linux/WorkQueue.h"
#include "tests/support/WorkQueueFake.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <semaphore>
#include <thread>

namespace {

using platform::QualityOfService;
using Queue = std::shared_ptr<platform::WorkQueue>;

class Event : public std::counting_semaphore<> {
public:
    Event() : counting_semaphore(0) {}
    void expect() { EXPECT_TRUE(try_acquire_for(std::chrono::seconds(30))); }
};

/// The same cases run on threads and on the twin in both its modes.
class WorkQueues : public testing::TestWithParam<const char*> {
protected:
    static std::unique_ptr<platform::WorkQueues> make(const std::string& kind) {
        if (kind == "Linux") return std::make_unique<platform::linux_::WorkQueues>();
        using enum support::FakeWorkQueues::Mode;
        return std::make_unique<support::FakeWorkQueues>(kind == "FakeManual" ? manual : inPlace);
    }
    std::function<void()> expecting(int number) {
        return [this, number] { EXPECT_EQ(next++, number); };
    }

    int next = 0; // the queue's
    const std::unique_ptr<platform::WorkQueues> queues = make(GetParam());
    Queue queue = queues->makeSerial("the label");
};

TEST_P(WorkQueues, ItemsOfAllKindsRunInTheOrderSubmitted) {
    for (int i = 0; i < 300; i += 3) {
        queue->async(expecting(i));
        queue->asyncOnCaller(expecting(i + 1));
        i % 5 == 0 ? queue->sync(expecting(i + 2)) : queue->async(expecting(i + 2));
    }
    queue->sync([&] {
        queue->async(expecting(301));
        queue->asyncOnCaller(expecting(302));
        expecting(300)();
    });
    queue->sync(expecting(303));
    queue->async([&] {
        queue->async(expecting(305));
        expecting(304)();
    });
    queue->sync([] {}); // that one has run
    queue->sync(expecting(306));
}

TEST_P(WorkQueues, ItemsOfADroppedQueueStillRun) {
    Event ran;
    queue->async([&, self = queue.get()] {
        self->assertCurrent();
        ran.release();
    });
    queue.reset();
    if (auto* const fake = dynamic_cast<support::FakeWorkQueues*>(queues.get())) fake->runAll();
    ran.expect();
}

TEST_P(WorkQueues, QueuesKnowTheirItemsAndMisuseStopsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    queue->sync([&] {
        const auto inner = queues->makeSerial("inner");
        inner->sync([&] { EXPECT_TRUE(queue->isCurrent() && inner->isCurrent()); });
        EXPECT_TRUE(queue->isCurrent() && !inner->isCurrent());
    });
    EXPECT_FALSE(queue->isCurrent());
    EXPECT_DEATH(queue->sync([&] { queue->sync([] {}); }), "\"the label\" is entered from itself");
    EXPECT_DEATH(queue->assertCurrent(), "not on work queue \"the label\"");
}

INSTANTIATE_TEST_SUITE_P(, WorkQueues, testing::Values("Linux", "FakeManual", "FakeInPlace"),
                         [](const auto& each) { return std::string(each.param); });

class LinuxWorkQueues : public testing::Test {
protected:
    /// Occupies `blocked` until `ended`.
    void block(const Queue& blocked) {
        blocked->async([this] {
            started.release();
            ended.acquire();
        });
        started.expect();
    }
    Queue make(QualityOfService quality = QualityOfService::standard) { return queues->makeSerial("label", quality); }

    Event started;
    Event ended;
    std::unique_ptr<platform::linux_::WorkQueues> queues = std::make_unique<platform::linux_::WorkQueues>();
    Queue queue = make();
};

TEST_F(LinuxWorkQueues, BlockedQueuesDoNotHoldUpOthers) {
    // Each one starts only if a thread is left for it; more than any machine's processors.
    const std::ptrdiff_t count = 2 * std::thread::hardware_concurrency() + 20;
    for (std::ptrdiff_t i = 0; i < count; ++i) block(make());
    ended.release(count);
}

TEST_F(LinuxWorkQueues, UserInitiatedQueuesGoFirstAndDestructionWaitsForAll) {
    queues = std::make_unique<platform::linux_::WorkQueues>(1);
    std::string order;
    const auto standard = make();
    const auto user = make(QualityOfService::userInitiated);
    block(make());
    standard->async([&] {
        order += 's';
        for (int i = 0; i < 1000; ++i) user->async([&] { order += 'l'; });
    });
    user->async([&] { order += 'u'; });
    ended.release();
    queues.reset();
    EXPECT_EQ(order, "us" + std::string(1000, 'l'));
}

TEST_F(LinuxWorkQueues, IdleQueuesSyncOnTheCallersThreadAndAreIdleAgainAlsoAfterAThrow) {
    const auto throwing = [&, self = std::this_thread::get_id()] {
        EXPECT_EQ(std::this_thread::get_id(), self);
        throw std::runtime_error("item");
    };
    for (int i = 0; i < 2; ++i) EXPECT_THROW(queue->sync(throwing), std::runtime_error);
    EXPECT_FALSE(queue->isCurrent());
}

TEST_F(LinuxWorkQueues, LentThreadsServeIdleQueuesButAreNotCaptured) {
    std::atomic<bool> isBack = false;
    const std::function<void()> endless = [&] { isBack ? ended.release() : queue->async(endless); };
    const auto ending = [&] { ended.release(); };
    {
        platform::linux_::LentThread lent;
        queue->asyncOnCaller([&, self = std::this_thread::get_id()] {
            EXPECT_EQ(std::this_thread::get_id(), self);
            started.release();
        });
        EXPECT_FALSE(started.try_acquire()); // not inside the call
        lent.serve();
        EXPECT_TRUE(started.try_acquire());
        queue->asyncOnCaller(endless);
        lent.serve();
        isBack = true; // never reached by a thread that runs whatever comes
        ended.expect();
        // What it has taken and not begun is left to others before it waits, and when it ends.
        queue->asyncOnCaller(ending);
        queue->sync([] {});
        ended.expect();
        queue->asyncOnCaller(ending);
    }
    ended.expect();
}

TEST_F(LinuxWorkQueues, ManyThreadsNeverOverlapAndEachKeepsItsOrder) {
    constexpr std::size_t rounds = 3000;
    const auto nested = make(QualityOfService::userInitiated);
    std::array<std::size_t, 4> runs{}; // no lock: the queue is one
    std::size_t nestedRuns = 0;
    std::array<std::jthread, runs.size()> threads;
    for (std::size_t thread = 0; thread < threads.size(); ++thread) {
        threads[thread] = std::jthread([&, thread] {
            for (std::size_t i = 0; i < rounds; ++i) {
                const auto item = [&, thread, i] {
                    ASSERT_EQ(runs[thread]++, i);
                    nested->sync([&] { ++nestedRuns; });
                };
                switch ((i + thread) % 3) {
                case 0: queue->async(item); break;
                case 1: queue->asyncOnCaller(item); break;
                default: queue->sync(item); break;
                }
            }
        });
    }
    for (std::jthread& thread : threads) thread.join();
    queue->sync([] {});
    nested->sync([&] { EXPECT_EQ(nestedRuns, runs.size() * rounds); });
}

} // namespace
