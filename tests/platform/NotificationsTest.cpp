#include "platform/linux/Notifications.h"
#include "platform/linux/DirectoryWatcher.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Mailbox.h"
#include "tests/support/NotificationsFake.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <future>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <thread>

namespace {

using Calls = support::Mailbox<int>;

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

    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("test", platform::QualityOfService::standard);
    Calls calls;
    World world;
};
using Worlds = testing::Types<LinuxNotifications, FakeNotifications>;
TYPED_TEST_SUITE(NotificationsConformance, Worlds);

TYPED_TEST(NotificationsConformance, PostReachesTheObserversOfThatName) {
    Calls others;
    this->post(); // before anybody observes
    const auto first = this->observe([&] {
        this->queue->assertCurrent();
        this->calls.put(0);
    });
    const auto other = this->world.poster.observe("com.example.other", this->queue, [&] { others.put(0); });
    const auto second = this->world.poster.observe(name, this->queue, [&] { this->calls.put(0); });
    for (int post = 0; post < 3; ++post) {
        this->post();
        EXPECT_TRUE(this->calls.take() && this->calls.take());
    }
    this->queue->sync([] {});
    EXPECT_EQ(this->calls.size() + others.size(), 0U) << "one call for each post, none for the one before";
    // What is posted while the queue is busy may arrive as one.
    std::promise<void> release;
    this->queue->async([&] { release.get_future().wait(); });
    for (int post = 0; post < 100; ++post) this->post();
    release.set_value();
    EXPECT_TRUE(this->calls.take() && this->calls.take());
}

TYPED_TEST(NotificationsConformance, ObservationEndsInsideAndOutsideItsHandler) {
    Calls ended;
    Calls once;
    auto outside = this->observe([&] { ended.put(0); });
    std::unique_ptr<platform::NotificationObservation> inside;
    this->queue->sync([&] {
        inside = this->observe([&] {
            inside.reset();
            once.put(0); // what the handler holds is good until it returns
        });
    });
    const auto stays = this->observe([&] { this->calls.put(0); });
    outside.reset();
    this->post();
    EXPECT_TRUE(this->calls.take() && once.take());
    this->post();
    EXPECT_TRUE(this->calls.take());
    this->queue->sync([] {});
    EXPECT_EQ(ended.size() + once.size(), 0U);
}

TYPED_TEST(NotificationsConformance, ObservationEndsWhilePostsArrive) {
    const std::jthread poster([&](const std::stop_token& end) {
        while (!end.stop_requested()) this->post();
    });
    for (int round = 0; round < 20; ++round) {
        auto told = std::make_unique<Calls>();
        auto observation = this->observe([&] { told->put(0); });
        EXPECT_TRUE(told->take());
        observation.reset();
        told.reset(); // no call may come any more
    }
}

class NotificationsOnDisk : public NotificationsConformance<LinuxNotifications> {
protected:
    std::unique_ptr<platform::NotificationObservation> observation = observe([this] { calls.put(0); });
};

TEST_F(NotificationsOnDisk, PostNeedsNoFileOfItsOwn) {
    // What somebody else put in the counter's place is not written to, and keeps no post from arriving.
    const std::string counter = world.directory + "/" + name;
    const std::string victim = world.scratch / "victim";
    std::ofstream(victim) << "untouched";
    const std::function<void()> squatters[] = {
        [&] { std::filesystem::create_symlink(victim, counter); },
        [&] { std::filesystem::create_hard_link(victim, counter); },
        [&] { mkfifo(counter.c_str(), 0666); },
        [] {},
    };
    for (const auto& squat : squatters) {
        std::filesystem::remove(counter);
        squat();
        post();
        EXPECT_TRUE(calls.take());
    }
    for (const char* refused : {"", "..", "../escaped", "a@b"}) world.poster.post(refused);
    EXPECT_FALSE(std::filesystem::exists(world.root.runtime() + "/escaped"));
    EXPECT_EQ(std::filesystem::file_size(victim), 9U);
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(world.directory), {}), 1) << "nothing is left over";
    EXPECT_EQ(std::filesystem::status(world.directory).permissions(), std::filesystem::perms(01777)) << "all users'";
}

TEST_F(NotificationsOnDisk, DirectoryMayGoAndComeAgain) {
    for (int round = 0; round < 3; ++round) {
        std::filesystem::rename(world.directory, world.scratch / std::to_string(round));
        EXPECT_TRUE(calls.take()) << "posts may have been lost, so observers are told";
        queue->sync([] {});
        while (calls.size() != 0) calls.take();
        post();
        EXPECT_TRUE(calls.take());
    }
}

TEST(DirectoryWatcher, OverflowIsReportedAsMissed) {
    const support::ScratchDirectory scratch;
    Calls missed;
    std::promise<void> release;
    const auto released = release.get_future().share();
    platform::linux_::DirectoryWatcher watcher(scratch.path(), IN_OPEN | IN_CLOSE_NOWRITE,
                                               {.makeDirectory = [] {},
                                                .changed = [&](std::uint32_t, std::string_view) { released.wait(); },
                                                .missed = [&] { missed.put(0); }});
    ASSERT_TRUE(watcher.start());
    int limit = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
    std::ofstream(scratch / "entry") << "content";
    // Two events that differ, so that none are merged; the watcher may read a bufferful before it waits.
    for (int events = 0; events < limit + 4096; events += 2) std::ifstream{scratch / "entry"};
    release.set_value();
    EXPECT_TRUE(missed.take());
}

} // namespace
