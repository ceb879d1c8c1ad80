#include "platform/linux/ServiceManager.h"
#include "platform/linux/Files.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/ServiceManagerFake.h"

#include <future>
#include <gtest/gtest.h>
#include <sys/stat.h>

using namespace platform;

namespace {

constexpr const char* identifier = "com.example.plug-in";

using Instance = support::WaitingProgram;

/// For an instance that does not end when it is asked to.
bool ignoreTermination() { return signal(SIGTERM, SIG_IGN) != SIG_ERR; }

struct OnLinux {
    support::ScratchDirectory scratch;
    linux_::Root root{scratch.path()};
    linux_::Files files{root};
    std::unique_ptr<ServiceManager> manager = withGrace(std::chrono::hours(1));
    std::vector<std::unique_ptr<Instance>> instances;

    std::unique_ptr<ServiceManager> withGrace(std::chrono::milliseconds grace) {
        return std::make_unique<linux_::ServiceManager>(root, files, grace);
    }
    std::string directory(const std::string& version) const {
        return root.runtime() + "/ignitd/" + identifier + "@" + version;
    }
    /// As an earlier daemon left it.
    void record(const std::string& version, const std::string& process, uid_t user = geteuid()) const {
        support::writeFile(directory(version) + '/' + process, std::to_string(user));
    }
    void startInstance(const std::string& version, const support::Preparation& prepare = support::atOnce) {
        instances.push_back(std::make_unique<Instance>("/bin/cat", prepare));
        record(version, linux_::ProcessIdentity::of(instances.back()->pid())->name());
    }
};

struct InMemory {
    std::unique_ptr<support::FakeServiceManager> manager = std::make_unique<support::FakeServiceManager>();

    InMemory() { manager->allow(); }
    void startInstance(const std::string& version) { manager->addInstance(identifier, version); }
};

template <class World> class ServiceManagerConformance : public testing::Test {
protected:
    /// The answer, which must come on the queue and once.
    std::future<int> remove(const std::string& version, const std::string& bundleIdentifier = identifier) {
        auto answer = std::make_shared<std::promise<int>>(); // a second answer throws
        world.manager->removeExternalService(bundleIdentifier, version, queue, [this, answer](int result) {
            queue->assertCurrent();
            answer->set_value(result);
        });
        return answer->get_future();
    }

    linux_::WorkQueues queues;
    std::shared_ptr<WorkQueue> queue = queues.makeSerial("killer", QualityOfService::standard);
    World world;
};
using Worlds = testing::Types<OnLinux, InMemory>;
TYPED_TEST_SUITE(ServiceManagerConformance, Worlds);
using ServiceManagerOnLinux = ServiceManagerConformance<OnLinux>;

} // namespace

TYPED_TEST(ServiceManagerConformance, RemoveEndsTheInstancesOfThatVersion) {
    EXPECT_EQ(this->remove("1").get(), serviceHasNoInstances);
    for (const char* version : {"1", "1", "2"}) this->world.startInstance(version);
    EXPECT_EQ(this->remove("1").get(), serviceInstancesTerminated);
    EXPECT_EQ(this->remove("1").get(), serviceHasNoInstances);
    EXPECT_EQ(this->remove("2").get(), serviceInstancesTerminated);
}

TEST_F(ServiceManagerOnLinux, RemoveAnswersAfterTheInstancesEnded) {
    for (const char* version : {"1", "1", "2"}) world.startInstance(version);
    EXPECT_EQ(remove("1").get(), serviceInstancesTerminated);
    for (const std::size_t index : {0U, 1U}) {
        EXPECT_TRUE(world.instances[index]->hasEnded());
        EXPECT_EQ(world.instances[index]->finish(), -SIGTERM);
    }
    EXPECT_FALSE(world.instances[2]->hasEnded());
    EXPECT_FALSE(std::filesystem::exists(world.directory("1"))) << "nothing is left of the service";
}

TEST_F(ServiceManagerOnLinux, RemoveKillsWhatLivesOnAfterTheGracePeriod) {
    world.manager = world.withGrace(std::chrono::milliseconds(20));
    world.startInstance("1", ignoreTermination);
    EXPECT_EQ(remove("1").get(), serviceInstancesTerminated);
    EXPECT_EQ(world.instances[0]->finish(), -SIGKILL);
}

TEST_F(ServiceManagerOnLinux, RemoveNeverSignalsWhatIsNoInstanceAnyMore) {
    const Instance innocent("/bin/cat");
    const std::string recycled = std::to_string(innocent.pid()) + "-1";
    world.record("1", recycled);
    // As one that runs a set-user-id program by now.
    world.record("1", linux_::ProcessIdentity::of(innocent.pid())->name(), geteuid() + 1);
    EXPECT_EQ(remove("1").get(), serviceHasNoInstances);
    EXPECT_FALSE(std::filesystem::exists(world.directory("1") + '/' + recycled)) << "stale";
    EXPECT_FALSE(innocent.hasEnded());
}

TEST_F(ServiceManagerOnLinux, RemoveDoesNotBelieveOpenDirectories) {
    world.startInstance("1");
    for (const std::string& open : {world.directory("1"), world.root.runtime() + "/ignitd"}) {
        ASSERT_EQ(chmod(open.c_str(), 0777), 0);
        EXPECT_EQ(remove("1").get(), EACCES);
        ASSERT_EQ(chmod(open.c_str(), 0755), 0);
    }
    std::filesystem::rename(world.directory("1"), world.directory("2"));
    std::filesystem::create_directory_symlink(world.directory("2"), world.directory("1"));
    EXPECT_EQ(remove("1").get(), ENOTDIR);
    EXPECT_FALSE(world.instances[0]->hasEnded());
}

TEST_F(ServiceManagerOnLinux, RefusesNamesThatAreNoNames) {
    const std::tuple<std::string, std::string, int> cases[] = {
        {"", "1", EINVAL},
        {"..", "1", EINVAL},
        {"a/../b", "1", EINVAL},
        {"a@b", "1", EINVAL},
        {"a", "../1", EINVAL},
        {"a", "1 @ beta", serviceHasNoInstances},
        {std::string(200, 'a'), std::string(200, '1'), ENAMETOOLONG}};
    for (const auto& [bundleIdentifier, version, answer] : cases)
        EXPECT_EQ(remove(version, bundleIdentifier).get(), answer) << bundleIdentifier << " " << version;
}

TEST_F(ServiceManagerOnLinux, DestructionCancelsWhatWaits) {
    world.startInstance("1", ignoreTermination);
    auto answer = remove("1");
    auto same = remove("1");
    world.manager.reset();
    EXPECT_EQ(answer.get(), ECANCELED);
    EXPECT_EQ(same.get(), ECANCELED);
    EXPECT_FALSE(world.instances[0]->hasEnded());
}
