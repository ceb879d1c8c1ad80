#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/BusyAssertion.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ProcessAssertionsFake.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>

namespace {

using platform::linux_::BusyAssertion;
using Names = std::vector<std::string>;
namespace fs = std::filesystem;

/// A child process that lives until it stops itself; killed when this object goes, so that nothing of its own tidies
/// up.
class Instance {
public:
    using Life = std::function<int()>;

    explicit Instance(const Life& life) : pid(support::startChild(life)) {
        int status = 0;
        EXPECT_TRUE(waitpid(pid, &status, WUNTRACED) == pid && WIFSTOPPED(status)) << "the child ended early";
    }
    ~Instance() {
        if (pid > 0 && kill(pid, SIGKILL) == 0) waitpid(pid, nullptr, 0);
    }
    Instance(const Instance&) = delete;

    const pid_t pid;
};

/// Dies with the test program; asked for here, since becoming another user takes it back.
int stop() { return prctl(PR_SET_PDEATHSIG, SIGKILL) == 0 ? raise(SIGSTOP) : 1; }

struct LinuxWorld {
    /// The life of an instance that is busy until it ends; of an ordinary user if asked for.
    Instance::Life busy(const std::string& bundle, bool isOrdinary = false) const {
        return [this, bundle, isOrdinary] {
            if (isOrdinary && !support::becomeOrdinaryUser()) return 1;
            const BusyAssertion assertion(root, bundle);
            return assertion.failure() ? 1 : stop();
        };
    }
    void startBusy(const std::string& bundle) { instances.emplace(bundle, busy(bundle)); }
    void endBusy(const std::string& bundle) { instances.erase(bundle); }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::ProcessAssertions assertions{root};
    const std::string shared = busyDirectory(root);
    const std::string own = shared + "/" + std::to_string(geteuid());
    std::multimap<std::string, Instance> instances;
};

struct FakeWorld {
    void startBusy(const std::string& bundle) { assertions.addBusy(bundle); }
    void endBusy(const std::string& bundle) { assertions.endBusy(bundle); }

    support::FakeProcessAssertions assertions;
};

/// The identifiers reported, in order.
Names busyOf(platform::ProcessAssertions& assertions, const std::set<std::string>& bundles = {"a", "b"}) {
    Names found;
    for (const auto& instance : assertions.busyExtensionInstances(bundles))
        found.emplace_back(*instance.string(platform::instanceBundleIdentifierKey));
    return found;
}

template <class World> class ProcessAssertionsConformance : public testing::Test {};
using Worlds = testing::Types<LinuxWorld, FakeWorld>;
TYPED_TEST_SUITE(ProcessAssertionsConformance, Worlds);

TYPED_TEST(ProcessAssertionsConformance, ReportsEachBusyInstanceOfTheAskedWhileItLasts) {
    TypeParam world;
    EXPECT_EQ(busyOf(world.assertions), Names());
    for (const char* bundle : {"a", "a", "b"}) world.startBusy(bundle);
    EXPECT_EQ(busyOf(world.assertions, {"a", "b", "c"}), (Names{"a", "a", "b"}));
    EXPECT_EQ(busyOf(world.assertions, {"b"}), Names{"b"});
    world.endBusy("a");
    EXPECT_EQ(busyOf(world.assertions), Names{"b"});
}

class ProcessAssertionsOnLinux : public testing::Test, protected LinuxWorld {};

TEST_F(ProcessAssertionsOnLinux, AProcessIsOneInstanceUntilItsLastAssertionEnds) {
    // Asked by another process: no process is told of its own locks.
    const auto count = [&] { return support::resultInChild([&] { return int(busyOf(assertions).size()); }); };
    auto first = std::make_optional<BusyAssertion>(root, "a");
    auto second = std::make_optional<BusyAssertion>(root, "a");
    EXPECT_EQ(count(), 1);
    first.reset();
    EXPECT_EQ(count(), 1) << "the second one still stands";
    second.reset();
    EXPECT_EQ(count(), 0);
}

TEST_F(ProcessAssertionsOnLinux, AForkedChildIsBusyOnceByItsOwnAssertion) {
    const BusyAssertion parents(root, "a");
    const Instance idle(stop);
    const Instance child(busy("a"));
    const platform::Dictionary expected{{platform::instanceBundleIdentifierKey, "a"},
                                        {platform::linux_::instanceUserKey, geteuid()},
                                        {platform::linux_::instanceProcessKey, child.pid}};
    EXPECT_EQ(assertions.busyExtensionInstances({"a"}), std::vector{expected});
    const Instance greedy([&] {
        const int file = open((own + "/a").c_str(), O_RDWR | O_CLOEXEC);
        for (off_t byte = 0; byte < 2000; byte = lseek(file, 2, SEEK_CUR)) {
            if (lockf(file, F_TLOCK, 1) != 0) return 1;
        }
        return stop();
    });
    EXPECT_EQ(busyOf(assertions), (Names{"a", "a"})) << "however many locks it holds";
}

TEST_F(ProcessAssertionsOnLinux, IdentifiersStayInTheDirectory) {
    support::processLog.clear();
    for (const std::string& bundle : {std::string(".."), std::string("../1000/a"), std::string(256, 'a')}) {
        EXPECT_TRUE(BusyAssertion(root, bundle).failure()) << bundle;
        EXPECT_EQ(busyOf(assertions, {bundle}), Names()) << bundle;
    }
    EXPECT_TRUE(support::processLog.lines().empty()) << "not even looked for";
}

TEST_F(ProcessAssertionsOnLinux, BelievesOnlyPrivateDirectoriesAndRealFiles) {
    const Instance instance(busy("a"));
    for (const auto& [directory, opened, closed] :
         {std::tuple(own, 0755U, 0700U), {own, 0770U, 0700U}, {shared, 0777U, 0755U}}) {
        chmod(directory.c_str(), opened);
        EXPECT_EQ(busyOf(assertions), Names()) << directory;
        EXPECT_EQ(BusyAssertion(root, "other").failure()->code, EACCES) << directory;
        chmod(directory.c_str(), closed);
        EXPECT_EQ(busyOf(assertions), Names{"a"}) << directory;
    }
    for (const std::string& name : {own, own + "/a"}) {
        support::putBehindLink(name);
        EXPECT_EQ(busyOf(assertions), Names()) << name;
        fs::remove(name);
        fs::rename(name + ".moved", name);
    }
    mkfifo((own + "/pipe").c_str(), 0600);
    EXPECT_EQ(busyOf(assertions, {"pipe", "a"}), Names{"a"});
}

TEST_F(ProcessAssertionsOnLinux, RootCountsEveryUserAndAUserOnlyThemself) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    chmod(scratch.path().c_str(), 0755);
    const Instance rooted(busy("a"));
    const Instance other(busy("b", true));
    EXPECT_EQ(busyOf(assertions), (Names{"a", "b"}));
    const auto seesItself = [&] { return int{support::becomeOrdinaryUser() && busyOf(assertions) == Names{"b"}}; };
    EXPECT_EQ(support::resultInChild(seesItself), 1);
    // A directory that somebody prepared in another's name.
    const std::string squatted = shared + "/65533";
    fs::create_directory(squatted);
    chmod(squatted.c_str(), 0700);
    fs::copy(own, squatted);
    const Instance pretender(
        [&] { return lockf(open((squatted + "/a").c_str(), O_RDWR | O_CLOEXEC), F_TLOCK, 1) == 0 ? stop() : 1; });
    EXPECT_EQ(busyOf(assertions, {"a"}), Names{"a"});
}

TEST_F(ProcessAssertionsOnLinux, NobodyWhoComesLaterIsMissedAmongOthersDirectories) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    chmod(scratch.path().c_str(), 0755);
    // In memory, where many changes take no time.
    if (mount("none", shared.c_str(), "tmpfs", 0, "mode=1777") != 0) GTEST_SKIP() << "may not mount";
    int mostChanges = 0; // that the kernel keeps
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> mostChanges;
    for (const char* squatted : {"/200000", "/200001"}) {
        fs::create_directory(shared + squatted);
        ASSERT_EQ(chown((shared + squatted).c_str(), support::ordinaryUser, 0), 0);
    }
    const std::pair<const char*, std::function<void()>> cases[] = {
        {"none", [] {}},
        {"many",
         [&] {
             for (int change = 0; change <= mostChanges; ++change) {
                 const std::string path = shared + (change % 2 == 0 ? "/100000" : "/100001");
                 ASSERT_TRUE(mkdir(path.c_str(), 0700) == 0 && rmdir(path.c_str()) == 0);
             }
         }},
        {"another directory around them", [&] { umount2(shared.c_str(), MNT_DETACH); }},
    };
    for (const auto& [change, make] : cases) {
        support::processLog.clear();
        platform::linux_::ProcessAssertions fresh(root);
        EXPECT_EQ(busyOf(fresh), Names()) << change;
        make();
        {
            const Instance other(busy("a", true));
            EXPECT_EQ(busyOf(fresh), Names{"a"}) << change;
        }
        EXPECT_EQ(busyOf(fresh), Names()) << change;
        fs::remove_all(shared + '/' + std::to_string(support::ordinaryUser));
        const auto lines = support::processLog.lines();
        EXPECT_EQ(std::ranges::count(lines, platform::LogLevel::error, &support::FakeSystemLog::Line::level), 1)
            << "that there are such directories";
    }
}

} // namespace
