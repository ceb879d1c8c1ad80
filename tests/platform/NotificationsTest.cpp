#include "platform/linux/Notifications.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>

namespace {

namespace fs = std::filesystem;
using Calls = support::Mailbox<int>;

constexpr const char* name = "com.example.change";

/// One object posts and another observes, as in two processes: they share nothing but the root.
struct Notifications : testing::Test {
    auto observe(std::function<void()> handler) { return observer.observe(name, queue, std::move(handler)); }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    std::string directory = root.runtime() + "/notifications";
    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("test", platform::QualityOfService::standard);
    Calls calls;
    platform::linux_::Notifications poster{root};
    platform::linux_::Notifications observer{root};
};

TEST_F(Notifications, ObservationEndsInsideItsHandlerAndWhilePostsArrive) {
    const std::jthread posts([&](const std::stop_token& end) {
        while (!end.stop_requested()) poster.post(name);
    });
    for (int round = 0; round < 20; ++round) {
        const bool endsInside = round % 2 == 0;
        auto told = std::make_unique<Calls>();
        std::unique_ptr<platform::NotificationObservation> observation;
        queue->sync([&] {
            observation = observe([&] {
                if (endsInside) observation.reset();
                told->put(0); // what the handler holds is good until it returns
            });
        });
        EXPECT_TRUE(told->take());
        if (!endsInside) observation.reset();
        queue->sync([] {});
        told.reset(); // no call may come any more
    }
}

TEST_F(Notifications, PostNeedsNoFileOfItsOwn) {
    // What somebody else put in the counter's place is not written to, and keeps no post from arriving.
    const auto observation = observe([this] { calls.put(0); });
    const std::string counter = directory + "/" + name;
    const std::string victim = scratch / "victim";
    std::ofstream{victim};
    const std::function<void()> squatters[] = {
        [&] { fs::create_symlink(victim, counter); },
        [&] { fs::create_hard_link(victim, counter); },
        [&] { mkfifo(counter.c_str(), 0666); },
        [] {},
    };
    for (const auto& squat : squatters) {
        fs::remove(counter);
        squat();
        poster.post(name);
        EXPECT_TRUE(calls.take());
    }
    for (const char* refused : {"", "..", "../escaped", "a@b"}) poster.post(refused);
    EXPECT_FALSE(fs::exists(root.runtime() + "/escaped"));
    EXPECT_TRUE(fs::is_empty(victim));
    EXPECT_EQ(std::distance(fs::directory_iterator(directory), {}), 1) << "nothing is left over";
    EXPECT_EQ(fs::status(directory).permissions(), fs::perms(01777)) << "all users'";
}

} // namespace
