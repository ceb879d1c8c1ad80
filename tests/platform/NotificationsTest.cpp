#include "platform/linux/Notifications.h"
#include "platform/linux/DirectoryWatcher.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/CallCounter.h"
#include "tests/support/NotificationsFake.h"
#include "tests/support/ScratchDirectory.h"

#include <filesystem>
#include <fstream>
#include <functional>
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
class LinuxNotifications {
public:
    platform::Notifications& poster() { return _poster; }
    platform::Notifications& observer() { return _observer; }
    std::string directory() const { return root.runtime() + "/notifications"; }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};

private:
    platform::linux_::Notifications _poster{root};
    platform::linux_::Notifications _observer{root};
};

class FakeNotifications {
public:
    platform::Notifications& poster() { return _notifications; }
    platform::Notifications& observer() { return _notifications; }

private:
    support::FakeNotifications _notifications;
};

template <class World> class NotificationsConformance : public testing::Test {
protected:
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
    this->world.poster().post(name); // before anybody observes
    const auto onFirst = this->world.observer().observe(name, this->queue, [&] {
        this->queue->assertCurrent();
        first.call();
    });
    const auto onSecond = this->world.poster().observe(name, this->queue, [&] { second.call(); });
    const auto onOthers = this->world.observer().observe("com.example.other", this->queue, [&] { others.call(); });
    for (int post = 1; post <= 3; ++post) {
        this->world.poster().post(name);
        EXPECT_TRUE(first.waitFor(post));
        EXPECT_TRUE(second.waitFor(post));
    }
    this->queue->sync([] {});
    EXPECT_EQ(first.count(), 3) << "one call for each post, none for the one before";
    EXPECT_EQ(others.count(), 0);
}

TYPED_TEST(NotificationsConformance, PostsWhileTheQueueIsBusyArriveAsOneOrMore) {
    CallCounter calls;
    std::promise<void> release;
    const auto observation = this->world.observer().observe(name, this->queue, [&] { calls.call(); });
    this->queue->async([&] { release.get_future().wait(); });
    for (int post = 0; post < 100; ++post) this->world.poster().post(name);
    release.set_value();
    EXPECT_TRUE(calls.waitFor(1));
}

TYPED_TEST(NotificationsConformance, ObservationEndsInsideAndOutsideItsHandler) {
    CallCounter ended;
    CallCounter once;
    CallCounter calls;
    auto outside = this->world.observer().observe(name, this->queue, [&] { ended.call(); });
    std::unique_ptr<platform::NotificationObservation> inside;
    this->queue->sync([&] {
        inside = this->world.observer().observe(name, this->queue, [&] {
            inside.reset();
            once.call(); // what the handler holds is good until it returns
        });
    });
    const auto stays = this->world.observer().observe(name, this->queue, [&] { calls.call(); });
    outside.reset();
    for (int post = 1; post <= 2; ++post) {
        this->world.poster().post(name);
        EXPECT_TRUE(calls.waitFor(post));
        EXPECT_TRUE(once.waitFor(1));
    }
    this->queue->sync([] {});
    EXPECT_EQ(ended.count(), 0);
    EXPECT_EQ(once.count(), 1);
}

TYPED_TEST(NotificationsConformance, ObservationEndsWhilePostsArrive) {
    std::atomic<bool> isEnding = false;
    std::thread poster([&] {
        while (!isEnding) this->world.poster().post(name);
    });
    for (int round = 0; round < 20; ++round) {
        auto calls = std::make_unique<CallCounter>();
        auto observation = this->world.observer().observe(name, this->queue, [&] { calls->call(); });
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
    std::unique_ptr<platform::NotificationObservation> observation =
        world.observer().observe(name, queue, [this] { calls.call(); });
};

TEST_F(NotificationsOnDisk, PostNeedsNoFileOfItsOwn) {
    // What somebody else put in the counter's place is not written to, and keeps no post from arriving.
    const std::string counter = world.directory() + "/" + name;
    const std::string victim = world.scratch / "victim";
    std::ofstream(victim) << "untouched";
    const std::pair<const char*, std::function<void()>> squatters[] = {
        {"link", [&] { std::filesystem::create_symlink(victim, counter); }},
        {"hard link", [&] { std::filesystem::create_hard_link(victim, counter); }},
        {"directory", [&] { std::filesystem::create_directory(counter); }},
        {"pipe", [&] { mkfifo(counter.c_str(), 0666); }},
    };
    int posts = 0;
    for (const auto& [kind, squat] : squatters) {
        SCOPED_TRACE(kind);
        squat();
        world.poster().post(name);
        EXPECT_TRUE(calls.waitFor(++posts));
        std::filesystem::remove(counter);
    }
    std::string content;
    std::ifstream(victim) >> content;
    EXPECT_EQ(content, "untouched");
    world.poster().post(name);
    EXPECT_TRUE(calls.waitFor(++posts));
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(world.directory()), {}), 1) << "nothing is left over";
}

TEST_F(NotificationsOnDisk, DirectoryMayGoAndComeAgain) {
    for (int round = 0; round < 3; ++round) {
        const int before = calls.count();
        std::filesystem::rename(world.directory(), world.scratch / std::to_string(round));
        EXPECT_TRUE(calls.waitFor(before + 1)) << "posts may have been lost, so observers are told";
        queue->sync([] {});
        const int told = calls.count();
        world.poster().post(name);
        EXPECT_TRUE(calls.waitFor(told + 1));
    }
}

TEST_F(NotificationsOnDisk, PostRefusesNamesThatAreNoNames) {
    for (const char* refused : {"", "..", "../escaped", "a@b"}) world.poster().post(refused);
    world.poster().post(name);
    EXPECT_TRUE(calls.waitFor(1));
    EXPECT_FALSE(std::filesystem::exists(world.root.runtime() + "/escaped"));
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(world.directory()), {}), 1);
}

TEST_F(NotificationsOnDisk, EveryUserMayPost) {
    struct stat status{};
    ASSERT_EQ(stat(world.directory().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 01777U);
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

TEST(DirectoryWatcher, ReplacedDirectoryIsWatchedInItsPlace) {
    support::ScratchDirectory scratch;
    CallCounter missed;
    CallCounter changed;
    const std::string directory = scratch / "watched";
    std::filesystem::create_directory(directory);
    platform::linux_::DirectoryWatcher watcher(directory, IN_CREATE,
                                               {.makeDirectory = [] {},
                                                .changed = [&](std::uint32_t, std::string_view) { changed.call(); },
                                                .missed = [&] { missed.call(); }});
    ASSERT_TRUE(watcher.start());
    std::filesystem::rename(directory, scratch / "former");
    std::filesystem::create_directory(directory);
    EXPECT_TRUE(missed.waitFor(1));
    std::filesystem::create_directory(scratch / "former/ignored");
    std::filesystem::create_directory(directory + "/told");
    EXPECT_TRUE(changed.waitFor(1));
    watcher.drain();
    EXPECT_EQ(changed.count(), 1);
}

} // namespace
