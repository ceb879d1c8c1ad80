#include "platform/linux/WorkQueue.h"
#include "tests/support/WorkQueueFake.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <semaphore>
#include <thread>

namespace {

using Queue = std::shared_ptr<platform::WorkQueue>;

bool brief() { return true; }

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
        queue->asyncOnCaller(expecting(i + 1), brief);
        i % 5 == 0 ? queue->sync(expecting(i + 2)) : queue->async(expecting(i + 2));
    }
    queue->sync([&] {
        queue->async(expecting(301));
        expecting(300)();
    });
    queue->async([&] {
        queue->asyncOnCaller(expecting(303), brief);
        expecting(302)();
    });
    queue->sync([] {}); // that one has run
    Event ran;
    queue->async([&] {
        expecting(304)();
        ran.release();
    });
    queue.reset(); // its items still run
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
    Event started;
    Event ended;
    platform::linux_::WorkQueues queues; // goes first, when all has run
    const Queue queue = queues.makeSerial("label", {});
};

TEST_F(LinuxWorkQueues, LentThreadsServeIdleQueuesButAreNotCaptured) {
    std::atomic<bool> isBack = false;
    const std::function<void()> endless = [&] { isBack ? ended.release() : queue->async(endless); };
    const auto ending = [&] { ended.release(); };
    {
        platform::linux_::LentThread lent;
        const auto self = std::this_thread::get_id();
        queue->asyncOnCaller(
            [&] {
                EXPECT_EQ(std::this_thread::get_id(), self);
                started.release();
            },
            brief);
        EXPECT_FALSE(started.try_acquire()); // not inside the call
        lent.serve();
        EXPECT_TRUE(started.try_acquire());
        const auto elsewhere = [&] {
            EXPECT_NE(std::this_thread::get_id(), self);
            started.release();
        };
        queue->asyncOnCaller(elsewhere, [] { return false; });
        lent.serve();
        started.acquire();
        queue->sync([] {});
        queue->asyncOnCaller(endless, brief);
        lent.serve();
        isBack = true; // never reached by a thread that runs whatever comes
        ended.expect();
        // What it has taken and not begun is left to others before it waits, and when it ends.
        queue->asyncOnCaller(ending, brief);
        queue->sync([] {});
        ended.expect();
        queue->asyncOnCaller(ending, brief);
    }
    ended.expect();
}

} // namespace
