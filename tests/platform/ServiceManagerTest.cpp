#include "platform/linux/ServiceManager.h"
#include "platform/linux/Files.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/ServiceManagerFake.h"

#include <cerrno>
#include <csignal>
#include <filesystem>
#include <future>
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>

namespace {

using std::chrono::milliseconds;

constexpr const char* identifier = "com.example.plug-in";

/// A process that does nothing until it is signalled.
class Sleeper {
public:
    enum class OnTerm { ends, ignores };

    explicit Sleeper(OnTerm onTerm = OnTerm::ends) {
        posix_spawnattr_t attributes;
        posix_spawnattr_init(&attributes);
        sigset_t blocked;
        sigemptyset(&blocked);
        if (onTerm == OnTerm::ignores) sigaddset(&blocked, SIGTERM);
        posix_spawnattr_setsigmask(&attributes, &blocked);
        posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK);
        std::string program = "sleep";
        std::string time = "100000";
        char* arguments[] = {program.data(), time.data(), nullptr};
        EXPECT_EQ(posix_spawnp(&_pid, "sleep", nullptr, &attributes, arguments, environ), 0);
        posix_spawnattr_destroy(&attributes);
    }
    ~Sleeper() {
        kill(_pid, SIGKILL);
        endingSignal();
    }
    Sleeper(const Sleeper&) = delete;
    Sleeper& operator=(const Sleeper&) = delete;

    pid_t pid() const { return _pid; }
    bool isRunning() const {
        siginfo_t info{};
        return waitid(P_PID, static_cast<id_t>(_pid), &info, WEXITED | WNOHANG | WNOWAIT) == 0 && info.si_pid == 0;
    }
    /// Waits for the end.
    int endingSignal() const {
        siginfo_t info{};
        waitid(P_PID, static_cast<id_t>(_pid), &info, WEXITED | WNOWAIT);
        return info.si_status;
    }

private:
    pid_t _pid = -1;
};

class LinuxServices {
public:
    explicit LinuxServices(milliseconds grace = std::chrono::hours(1))
        : manager(std::make_unique<platform::linux_::ServiceManager>(root, files, grace)) {}

    void startInstance(const std::string& version) {
        sleepers.push_back(std::make_unique<Sleeper>());
        record(version, sleepers.back()->pid());
    }
    /// As an earlier daemon left it.
    void record(const std::string& version, pid_t pid, uid_t user = geteuid()) const {
        support::writeFile(directory(version) + '/' + platform::linux_::ProcessIdentity::of(pid)->name(),
                           std::to_string(user));
    }
    std::string directory(const std::string& version) const {
        return root.runtime() + "/ignitd/" + identifier + "@" + version;
    }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};
    std::unique_ptr<platform::linux_::ServiceManager> manager;
    std::vector<std::unique_ptr<Sleeper>> sleepers;
};

class FakeServices {
public:
    FakeServices() { manager->allow(); }
    void startInstance(const std::string& version) { manager->addInstance(identifier, version); }

    std::unique_ptr<support::FakeServiceManager> manager = std::make_unique<support::FakeServiceManager>();
};

template <class World> class ServiceManagerConformance : public testing::Test {
protected:
    /// The answer, which must come on the queue and once.
    std::future<int> remove(platform::ServiceManager& manager, const std::string& version,
                            const std::string& bundleIdentifier = identifier) {
        auto answer = std::make_shared<std::promise<int>>(); // a second answer throws
        manager.removeExternalService(bundleIdentifier, version, queue, [this, answer](int result) {
            queue->assertCurrent();
            answer->set_value(result);
        });
        return answer->get_future();
    }

    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("killer", platform::QualityOfService::standard);
};
using Worlds = testing::Types<LinuxServices, FakeServices>;
TYPED_TEST_SUITE(ServiceManagerConformance, Worlds);

TYPED_TEST(ServiceManagerConformance, RemoveEndsTheInstancesOfThatVersion) {
    TypeParam world;
    auto& manager = *world.manager;
    EXPECT_EQ(this->remove(manager, "1").get(), platform::serviceHasNoInstances);
    world.startInstance("1");
    world.startInstance("1");
    world.startInstance("2");
    EXPECT_EQ(this->remove(manager, "1").get(), platform::serviceInstancesTerminated);
    EXPECT_EQ(this->remove(manager, "1").get(), platform::serviceHasNoInstances);
    EXPECT_EQ(this->remove(manager, "2").get(), platform::serviceInstancesTerminated);
}

TEST(FakeServiceManager, RefusesUntilAllowedAndFailsWhenTold) {
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("killer", platform::QualityOfService::standard);
    std::vector<int> results;
    {
        support::FakeServiceManager manager;
        const platform::AuditToken host;
        EXPECT_EQ(manager.addExternalServiceForHost(host, "/program", {}), EPERM);
        const auto remove = [&](const char* version) {
            manager.removeExternalService(identifier, version, queue, [&](int result) { results.push_back(result); });
        };
        remove("1");
        manager.allow();
        manager.failAdditions(EIO);
        EXPECT_EQ(manager.addExternalServiceForHost(host, "/program", {}), EIO);
        manager.failAdditions(0);
        EXPECT_EQ(manager.addExternalServiceForHost(host, "/program", {}), 0);
        EXPECT_EQ(manager.additions().size(), 1U);
        manager.fail(identifier, "2", EIO);
        remove("2");
        manager.holdAnswers();
        remove("2");
        remove("1");
        EXPECT_TRUE(manager.answer());
    }
    queue->sync([&] { EXPECT_EQ(results, (std::vector<int>{EPERM, EIO, EIO, ECANCELED})); });
}

class ServiceManagerOnLinux : public ServiceManagerConformance<LinuxServices> {};

TEST_F(ServiceManagerOnLinux, RemoveAnswersAfterTheInstancesEnded) {
    LinuxServices world;
    world.startInstance("1");
    world.startInstance("1");
    world.startInstance("2");
    ASSERT_EQ(remove(*world.manager, "1").get(), 0);
    for (int i = 0; i < 2; ++i) {
        ASSERT_FALSE(world.sleepers[static_cast<std::size_t>(i)]->isRunning());
        EXPECT_EQ(world.sleepers[static_cast<std::size_t>(i)]->endingSignal(), SIGTERM);
    }
    EXPECT_TRUE(world.sleepers[2]->isRunning());
    EXPECT_FALSE(std::filesystem::exists(world.directory("1"))) << "nothing is left of the service";
}

TEST_F(ServiceManagerOnLinux, RemoveKillsWhatLivesOnAfterTheGracePeriod) {
    LinuxServices world(milliseconds(20));
    const Sleeper stubborn(Sleeper::OnTerm::ignores);
    world.record("1", stubborn.pid());
    EXPECT_EQ(remove(*world.manager, "1").get(), 0);
    EXPECT_EQ(stubborn.endingSignal(), SIGKILL);
}

TEST_F(ServiceManagerOnLinux, RemoveNeverSignalsWhatIsNoInstanceAnyMore) {
    LinuxServices world;
    const Sleeper innocent;
    const std::string recycled = world.directory("1") + "/" + std::to_string(innocent.pid()) + "-1";
    support::writeFile(recycled, std::to_string(geteuid()));
    world.record("1", innocent.pid(), geteuid() + 1); // as one that runs a set-user-id program by now
    EXPECT_EQ(remove(*world.manager, "1").get(), platform::serviceHasNoInstances);
    EXPECT_FALSE(std::filesystem::exists(recycled)) << "stale";
    EXPECT_TRUE(innocent.isRunning());
}

TEST_F(ServiceManagerOnLinux, RemoveDoesNotBelieveOpenDirectories) {
    LinuxServices world;
    world.startInstance("1");
    for (const std::string& open : {world.directory("1"), world.root.runtime() + "/ignitd"}) {
        ASSERT_EQ(chmod(open.c_str(), 0777), 0);
        EXPECT_EQ(remove(*world.manager, "1").get(), EACCES);
        ASSERT_EQ(chmod(open.c_str(), 0755), 0);
    }
    std::filesystem::rename(world.directory("1"), world.directory("2"));
    std::filesystem::create_directory_symlink(world.directory("2"), world.directory("1"));
    EXPECT_EQ(remove(*world.manager, "1").get(), ENOTDIR);
    EXPECT_TRUE(world.sleepers[0]->isRunning());
}

TEST_F(ServiceManagerOnLinux, RefusesNamesThatAreNoNames) {
    LinuxServices world;
    const std::tuple<std::string, std::string, int> cases[] = {
        {"", "1", EINVAL},       {"..", "1", EINVAL},
        {"a/../b", "1", EINVAL}, {"a@b", "1", EINVAL},
        {"a", "", EINVAL},       {"a", "../1", EINVAL},
        {"a", "1\n", EINVAL},    {std::string(200, 'a'), std::string(200, '1'), ENAMETOOLONG}};
    for (const auto& [bundleIdentifier, version, error] : cases) {
        EXPECT_EQ(remove(*world.manager, version, bundleIdentifier).get(), error) << bundleIdentifier << " " << version;
    }
    EXPECT_EQ(remove(*world.manager, "1 @ beta", "a").get(), platform::serviceHasNoInstances);
}

TEST_F(ServiceManagerOnLinux, DestructionCancelsWhatWaits) {
    LinuxServices world;
    const Sleeper stubborn(Sleeper::OnTerm::ignores);
    world.record("1", stubborn.pid());
    auto answer = remove(*world.manager, "1");
    auto same = remove(*world.manager, "1");
    world.manager.reset();
    EXPECT_EQ(answer.get(), ECANCELED);
    EXPECT_EQ(same.get(), ECANCELED);
    EXPECT_TRUE(stubborn.isRunning());
}

} // namespace
