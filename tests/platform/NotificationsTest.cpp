#include "platform/linux/Notifications.h"
#include "platform/linux/DirectoryWatcher.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/CallCounter.h"
#include "tests/support/NotificationsFake.h"
#include "tests/support/ScratchDirectory.h"

#include <filesystem>
#include <fstream>
#include <future>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <thread>

namespace {

using platform::QualityOfService;
using support::CallCounter;

constexpr const char* name = "com.example.change";

/// One object posts and another observes, as in two processes: they share nothing but the root.
struct LinuxNotifications {
    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    std::string directory = root.runtime() + "/notifications";
    platform::linux_::Notifications poster{root};
    platform::linux_::Notifications observer{root};
};

struct FakeNotifications {
    support::FakeNotifications poster;
    platform::Notifications& observer = poster;
};

template <class World> class NotificationsConformance : public testing::Test {
protected:
    void post() { world.poster.post(name); }
    std::unique_ptr<platform::NotificationObservation> observe(std::function<void()> handler) {
        return world.observer.observe(name, queue, std::move(handler));
    }
    /// How many files the platform keeps.
    auto files() { return std::distance(std::filesystem::directory_iterator(world.directory), {}); }

    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("test", QualityOfService::standard);
    World world;
};
using Worlds = testing::Types<LinuxNotifications, FakeNotifications>;
TYPED_TEST_SUITE(NotificationsConformance, Worlds);

TYPED_TEST(NotificationsConformance, PostReachesTheObserversOfThatName) {
    CallCounter first;
    CallCounter second;
    CallCounter others;
    this->post(); // before anybody observes
    const auto onFirst = this->observe([&] {
        this->queue->assertCurrent();
        first.call();
    });
    const auto onSecond = this->world.poster.observe(name, this->queue, [&] { second.call(); });
    const auto onOthers = this->world.observer.observe("com.example.other", this->queue, [&] { others.call(); });
    for (int post = 1; post <= 3; ++post) {
        this->post();
        EXPECT_TRUE(first.waitFor(post) && second.waitFor(post));
    }
    this->queue->sync([] {});
    EXPECT_EQ(first.count(), 3) << "one call for each post, none for the one before";
    EXPECT_EQ(others.count(), 0);
    // What is posted while the queue is busy may arrive as one.
    std::promise<void> release;
    this->queue->async([&] { release.get_future().wait(); });
    for (int post = 0; post < 100; ++post) this->post();
    release.set_value();
    EXPECT_TRUE(first.waitFor(4));
}

TYPED_TEST(NotificationsConformance, ObservationEndsInsideAndOutsideItsHandler) {
    CallCounter ended;
    CallCounter once;
    CallCounter calls;
    auto outside = this->observe([&] { ended.call(); });
    std::unique_ptr<platform::NotificationObservation> inside;
    this->queue->sync([&] {
        inside = this->observe([&] {
            inside.reset();
            once.call(); // what the handler holds is good until it returns
        });
    });
    const auto stays = this->observe([&] { calls.call(); });
    outside.reset();
    for (int post = 1; post <= 2; ++post) {
        this->post();
        EXPECT_TRUE(calls.waitFor(post) && once.waitFor(1));
    }
    this->queue->sync([] {});
    EXPECT_EQ(ended.count(), 0);
    EXPECT_EQ(once.count(), 1);
}

TYPED_TEST(NotificationsConformance, ObservationEndsWhilePostsArrive) {
    std::atomic<bool> isEnding = false;
    std::thread poster([&] {
        while (!isEnding) this->post();
    });
    for (int round = 0; round < 20; ++round) {
        auto calls = std::make_unique<CallCounter>();
        auto observation = this->observe([&] { calls->call(); });
        EXPECT_TRUE(calls->waitFor(1));
        observation.reset();
        calls.reset(); // no call may come any more
    }
    isEnding = true;
    poster.join();
}

class NotificationsOnDisk : public NotificationsConformance<LinuxNotifications> {
protected:
    CallCounter calls;
    std::unique_ptr<platform::NotificationObservation> observation = observe([this] { calls.call(); });
};

TEST_F(NotificationsOnDisk, PostNeedsNoFileOfItsOwn) {
    // What somebody else put in the counter's place is not written to, and keeps no post from arriving.
    const std::string counter = world.directory + "/" + name;
    const std::string victim = world.scratch / "victim";
    std::ofstream(victim) << "untouched";
    const std::function<void()> squatters[] = {
        [&] { std::filesystem::create_symlink(victim, counter); },
        [&] { std::filesystem::create_hard_link(victim, counter); },
        [&] { std::filesystem::create_directory(counter); },
        [&] { mkfifo(counter.c_str(), 0666); },
        [] {},
    };
    int posts = 0;
    for (const auto& squat : squatters) {
        std::filesystem::remove(counter);
        squat();
        post();
        EXPECT_TRUE(calls.waitFor(++posts)) << posts;
    }
    std::string content;
    std::ifstream(victim) >> content;
    EXPECT_EQ(content, "untouched");
    EXPECT_EQ(files(), 1) << "nothing is left over";
}

TEST_F(NotificationsOnDisk, DirectoryMayGoAndComeAgain) {
    for (int round = 0; round < 3; ++round) {
        const int before = calls.count();
        std::filesystem::rename(world.directory, world.scratch / std::to_string(round));
        EXPECT_TRUE(calls.waitFor(before + 1)) << "posts may have been lost, so observers are told";
        queue->sync([] {});
        const int told = calls.count();
        post();
        EXPECT_TRUE(calls.waitFor(told + 1));
    }
}

TEST_F(NotificationsOnDisk, EveryUserMayPostButOnlyNames) {
    for (const char* refused : {"", "..", "../escaped", "a@b"}) world.poster.post(refused);
    post();
    EXPECT_TRUE(calls.waitFor(1));
    EXPECT_FALSE(std::filesystem::exists(world.root.runtime() + "/escaped"));
    EXPECT_EQ(files(), 1);
    EXPECT_EQ(std::filesystem::status(world.directory).permissions(), std::filesystem::perms(01777));
}

TEST(DirectoryWatcher, OverflowIsReportedAsMissed) {
    support::ScratchDirectory scratch;
    CallCounter missed;
    std::promise<void> release;
    auto released = release.get_future().share();
    platform::linux_::DirectoryWatcher watcher(scratch.path(), IN_OPEN | IN_CLOSE_NOWRITE,
                                               {.makeDirectory = [] {},
                                                .changed = [&](std::uint32_t, std::string_view) { released.wait(); },
                                                .missed = [&] { missed.call(); }});
    ASSERT_TRUE(watcher.start());
    int limit = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
    const std::string entry = scratch / "entry";
    std::ofstream(entry) << "content";
    // Two events that differ, so that none are merged; the watcher may read a bufferful before it waits.
    for (int events = 0; events < limit + 4096; events += 2) std::ifstream{entry};
    release.set_value();
    EXPECT_TRUE(missed.waitFor(1));
}

} // namespace
