#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/BusyAssertion.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using platform::linux_::BusyAssertion;
using Names = std::vector<std::string>;
using Life = std::function<int()>;
namespace fs = std::filesystem;

/// A child process that lives until it stops itself; killed when this object goes, so that nothing of its own tidies
/// up.
class Instance {
public:
    explicit Instance(const Life& life) : _pid(support::startChild(life)) {
        int status = 0;
        EXPECT_TRUE(waitpid(_pid, &status, WUNTRACED) == _pid && WIFSTOPPED(status)) << "the child ended early";
    }
    ~Instance() {
        if (_pid > 0 && kill(_pid, SIGKILL) == 0) waitpid(_pid, nullptr, 0);
    }
    Instance(const Instance&) = delete;

private:
    const pid_t _pid;
};

/// Dies with the test program; asked for here, since becoming another user takes it back.
int stop() { return prctl(PR_SET_PDEATHSIG, SIGKILL) == 0 ? raise(SIGSTOP) : 1; }

struct ProcessAssertions : testing::Test {
    ProcessAssertions() { chmod(scratch.path().c_str(), 0755); }
    /// The life of an instance that is busy until it ends; of an ordinary user if asked for.
    Life busy(const std::string& bundle, bool isOrdinary = false) const {
        return [this, bundle, isOrdinary] {
            if (isOrdinary && !support::becomeOrdinaryUser()) return 1;
            const BusyAssertion assertion(root, bundle);
            return assertion.failure() ? 1 : stop();
        };
    }
    /// The identifiers reported, in order.
    static Names busyOf(platform::ProcessAssertions& assertions, const std::set<std::string>& bundles = {"a", "b"}) {
        Names found;
        for (const auto& instance : assertions.busyExtensionInstances(bundles))
            found.emplace_back(*instance.string(platform::instanceBundleIdentifierKey));
        return found;
    }

    support::ScratchDirectory scratch{"/dev/shm"}; // where many changes take no time
    platform::linux_::Root root{scratch.path()};
    platform::linux_::ProcessAssertions assertions{root};
    const std::string shared = busyDirectory(root);
    const std::string own = shared + "/" + std::to_string(geteuid());
};

TEST_F(ProcessAssertions, ReportsEachBusyInstanceOfTheAskedWhileItLasts) {
    const BusyAssertion parents(root, "a"); // which it does not share with its children
    const Instance idle(stop);
    EXPECT_EQ(busyOf(assertions), Names());
    const Instance b(busy("b"));
    {
        const Instance first(busy("a"));
        const Instance second(busy("a"));
        EXPECT_EQ(busyOf(assertions, {"a", "b", "c"}), (Names{"a", "a", "b"}));
        EXPECT_EQ(busyOf(assertions, {"a"}), (Names{"a", "a"}));
    }
    EXPECT_EQ(busyOf(assertions), Names{"b"});
}

TEST_F(ProcessAssertions, BelievesOnlyPrivateDirectoriesAndRealFiles) {
    const Instance instance(busy("a"));
    for (const auto& [directory, opened, closed] :
         {std::tuple(own, 0755U, 0700U), {own, 0770U, 0700U}, {shared, 0777U, 0755U}}) {
        chmod(directory.c_str(), opened);
        EXPECT_EQ(busyOf(assertions), Names()) << directory;
        EXPECT_EQ(BusyAssertion(root, "other").failure()->code, EACCES) << directory;
        chmod(directory.c_str(), closed);
        EXPECT_EQ(busyOf(assertions), Names{"a"}) << directory;
    }
    mkfifo((own + "/pipe").c_str(), 0600);
    EXPECT_EQ(busyOf(assertions, {"pipe", "a", "../0/a", "./a"}), Names{"a"});
    support::putBehindLink(own + "/a");
    EXPECT_EQ(busyOf(assertions), Names());
}

TEST_F(ProcessAssertions, RootCountsEveryUserAndAUserOnlyThemself) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    const Instance rooted(busy("a"));
    const Instance other(busy("b", true));
    EXPECT_EQ(busyOf(assertions), (Names{"a", "b"}));
    const auto seesItself = [&] { return int{support::becomeOrdinaryUser() && busyOf(assertions) == Names{"b"}}; };
    EXPECT_EQ(support::resultInChild(seesItself), 1);
    fs::rename(own, shared + "/65533"); // as if somebody had prepared it in another's name
    EXPECT_EQ(busyOf(assertions), Names{"b"});
}

TEST_F(ProcessAssertions, NobodyWhoComesLaterIsMissed) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    int mostChanges = 0; // that the kernel keeps
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> mostChanges;
    for (const int changes : {0, mostChanges + 1}) {
        platform::linux_::ProcessAssertions fresh(root);
        EXPECT_EQ(busyOf(fresh), Names());
        for (int change = 0; change < changes; ++change) {
            const std::string path = shared + (change % 2 == 0 ? "/100000" : "/100001");
            EXPECT_TRUE(mkdir(path.c_str(), 0700) == 0 && rmdir(path.c_str()) == 0);
        }
        const Instance other(busy("a", true));
        EXPECT_EQ(busyOf(fresh), Names{"a"}) << changes;
        fs::remove_all(shared + '/' + std::to_string(support::ordinaryUser));
    }
}

} // namespace
