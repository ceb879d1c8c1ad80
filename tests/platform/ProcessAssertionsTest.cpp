#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/BusyAssertion.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ProcessAssertionsFake.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/SystemLogFake.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <functional>
#include <gtest/gtest.h>
#include <memory>
#include <optional>
#include <sys/mount.h>
#include <sys/stat.h>
#include <tuple>

namespace {

using platform::linux_::BusyAssertion;

constexpr const char* identifier = "com.example.plug-in";

/// A child process that stops in its life wherever it calls `pause`, until this object lets it go on or ends it.
class Instance {
public:
    using Life = std::function<void(const std::function<void()>& pause)>;

    explicit Instance(const Life& life) {
        int commands[2];
        int reports[2];
        if (pipe2(commands, O_CLOEXEC) != 0 || pipe2(reports, O_CLOEXEC) != 0) return;
        _pid = fork();
        if (_pid == 0) {
            alarm(30); // to fail instead of hanging
            close(commands[1]);
            life([&] {
                char byte = 0;
                if (write(reports[1], "x", 1) != 1 || read(commands[0], &byte, 1) != 1) _exit(0);
            });
            _exit(0);
        }
        close(commands[0]);
        close(reports[1]);
        _commands = commands[1];
        _reports = reports[0];
        awaitPause();
    }
    ~Instance() {
        end();
        close(_commands);
        close(_reports);
    }
    Instance(const Instance&) = delete;
    Instance& operator=(const Instance&) = delete;

    pid_t pid() const { return _pid; }
    /// Returns at the next pause.
    void goOn() {
        EXPECT_EQ(write(_commands, "x", 1), 1);
        awaitPause();
    }
    /// Killed, so that nothing of its own tidies up.
    void end() {
        if (_pid < 0) return;
        kill(_pid, SIGKILL);
        waitpid(_pid, nullptr, 0);
        _pid = -1;
    }

private:
    void awaitPause() const {
        char byte = 0;
        EXPECT_EQ(read(_reports, &byte, 1), 1) << "the child ended early";
    }

    pid_t _pid = -1;
    int _commands = -1;
    int _reports = -1;
};

bool lockByte(int file, off_t byte) {
    struct flock lock{};
    lock.l_type = F_WRLCK;
    lock.l_start = byte;
    lock.l_len = 1;
    return fcntl(file, F_SETLK, &lock) == 0;
}

class LinuxAssertions {
public:
    /// An instance that is busy until it ends; of an ordinary user if asked for.
    std::unique_ptr<Instance> busy(const std::string& bundle, bool isOrdinary = false) const {
        return std::make_unique<Instance>([&](const auto& pause) {
            if (isOrdinary && !support::becomeOrdinaryUser()) return;
            const BusyAssertion assertion(root, bundle);
            if (!assertion.failure()) pause();
        });
    }
    void startBusy(const std::string& bundle) { instances.emplace(bundle, busy(bundle)); }
    void endBusy(const std::string& bundle) { instances.erase(bundle); }
    std::string ownDirectory() const { return busyDirectory(root) + "/" + std::to_string(geteuid()); }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::ProcessAssertions assertions{root};
    std::multimap<std::string, std::unique_ptr<Instance>> instances;
};

class FakeAssertions {
public:
    void startBusy(const std::string& bundle) { assertions.addBusy(bundle); }
    void endBusy(const std::string& bundle) { assertions.endBusy(bundle); }

    support::FakeProcessAssertions assertions;
};

/// The identifiers reported, in order.
std::vector<std::string> busyOf(platform::ProcessAssertions& assertions, const std::set<std::string>& bundles) {
    std::vector<std::string> found;
    for (const auto& instance : assertions.busyExtensionInstances(bundles)) {
        found.emplace_back(instance.string(platform::instanceBundleIdentifierKey).value_or("incomplete"));
    }
    return found;
}
using Names = std::vector<std::string>;

template <class World> class ProcessAssertionsConformance : public testing::Test {};
using Worlds = testing::Types<LinuxAssertions, FakeAssertions>;
TYPED_TEST_SUITE(ProcessAssertionsConformance, Worlds);

TYPED_TEST(ProcessAssertionsConformance, ReportsEachBusyInstanceOfTheAskedWhileItLasts) {
    TypeParam world;
    EXPECT_EQ(busyOf(world.assertions, {"a", "b"}), Names());
    world.startBusy("a");
    world.startBusy("a");
    world.startBusy("b");
    EXPECT_EQ(busyOf(world.assertions, {"a", "b", "c"}), (Names{"a", "a", "b"}));
    EXPECT_EQ(busyOf(world.assertions, {"b"}), Names{"b"});
    world.endBusy("a");
    EXPECT_EQ(busyOf(world.assertions, {"a", "b"}), Names{"b"});
}

TEST(FakeProcessAssertions, ReportsIncompleteInstances) {
    support::FakeProcessAssertions assertions;
    assertions.addIncomplete("a");
    assertions.addBusy("a");
    EXPECT_EQ(busyOf(assertions, {"a"}), (Names{"incomplete", "a"}));
}

TEST(ProcessAssertionsOnLinux, AProcessIsOneInstanceUntilItsLastAssertionEnds) {
    LinuxAssertions world;
    Instance instance([&](const auto& pause) {
        auto first = std::make_optional<BusyAssertion>(world.root, identifier);
        auto second = std::make_optional<BusyAssertion>(world.root, identifier);
        pause();
        first.reset();
        pause();
        second.reset();
        pause();
    });
    EXPECT_EQ(busyOf(world.assertions, {identifier}), Names{identifier});
    instance.goOn();
    EXPECT_EQ(busyOf(world.assertions, {identifier}), Names{identifier}) << "the second one still stands";
    instance.goOn();
    EXPECT_EQ(busyOf(world.assertions, {identifier}), Names());
}

TEST(ProcessAssertionsOnLinux, AForkedChildIsBusyOnlyByItsOwnAssertion) {
    LinuxAssertions world;
    auto parent = std::make_unique<Instance>([&](const auto& pause) {
        const BusyAssertion assertion(world.root, identifier);
        if (fork() == 0) { // outlives its parent
            pause();
            const BusyAssertion own(world.root, identifier);
            pause();
            _exit(0);
        }
        ::pause();
    });
    EXPECT_EQ(busyOf(world.assertions, {identifier}), Names{identifier});
    parent->end();
    EXPECT_EQ(busyOf(world.assertions, {identifier}), Names()) << "the dead parent is not busy";
    parent->goOn();
    EXPECT_EQ(busyOf(world.assertions, {identifier}), Names{identifier});
}

TEST(ProcessAssertionsOnLinux, IdentifiersStayInTheDirectory) {
    LinuxAssertions world;
    support::processLog.clear();
    const std::pair<std::string, int> cases[] = {{"", EINVAL},
                                                 {".", EINVAL},
                                                 {"..", EINVAL},
                                                 {"../1000/a", EINVAL},
                                                 {"/etc/passwd", EINVAL},
                                                 {"a\nb", EINVAL},
                                                 {std::string(256, 'a'), ENAMETOOLONG}};
    for (const auto& [bundle, number] : cases) {
        const BusyAssertion assertion(world.root, bundle);
        ASSERT_TRUE(assertion.failure()) << bundle;
        EXPECT_EQ(assertion.failure()->code, number) << bundle;
        EXPECT_EQ(busyOf(world.assertions, {bundle}), Names()) << bundle;
    }
    EXPECT_TRUE(support::processLog.lines().empty()) << "not even looked for";
    world.startBusy(std::string(255, 'a'));
    EXPECT_EQ(busyOf(world.assertions, {std::string(255, 'a')}).size(), 1U);
}

TEST(ProcessAssertionsOnLinux, BelievesOnlyPrivateDirectoriesAndRealFiles) {
    LinuxAssertions world;
    const auto instance = world.busy(identifier);
    const std::string own = world.ownDirectory();
    const std::string shared = busyDirectory(world.root);
    const auto isBusy = [&] { return !busyOf(world.assertions, {identifier}).empty(); };
    for (const auto& [directory, open, closed] :
         {std::tuple(own, 0755, 0700), std::tuple(own, 0770, 0700), std::tuple(shared, 0777, 0755)}) {
        chmod(directory.c_str(), static_cast<mode_t>(open));
        EXPECT_FALSE(isBusy()) << directory;
        EXPECT_EQ(BusyAssertion(world.root, "other").failure()->code, EACCES) << directory;
        chmod(directory.c_str(), static_cast<mode_t>(closed));
        EXPECT_TRUE(isBusy()) << directory;
    }
    std::filesystem::rename(own, own + "-moved");
    std::filesystem::create_directory_symlink(own + "-moved", own);
    EXPECT_FALSE(isBusy());
    std::filesystem::remove(own);
    std::filesystem::rename(own + "-moved", own);
    std::filesystem::rename(own + "/" + identifier, own + "/moved");
    std::filesystem::create_symlink("moved", own + "/" + identifier);
    EXPECT_FALSE(isBusy()) << "link to a file";
    ASSERT_EQ(mkfifo((own + "/pipe").c_str(), 0600), 0);
    EXPECT_EQ(busyOf(world.assertions, {"pipe", "moved"}), Names{"moved"});
}

TEST(ProcessAssertionsOnLinux, RootCountsEveryUserAndAUserOnlyThemself) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    LinuxAssertions world;
    chmod(world.scratch.path().c_str(), 0755);
    const auto own = world.busy("a");
    const auto other = world.busy("b", true);
    EXPECT_EQ(busyOf(world.assertions, {"a", "b"}), (Names{"a", "b"}));
    EXPECT_EQ(support::resultInChild([&] {
                  if (!support::becomeOrdinaryUser()) return 1;
                  return busyOf(world.assertions, {"a", "b"}) == Names{"b"} ? 0 : 2;
              }),
              0);
    // A directory that somebody prepared in another's name.
    const std::string squatted = busyDirectory(world.root) + "/65533";
    std::filesystem::create_directory(squatted);
    chmod(squatted.c_str(), 0700);
    std::filesystem::copy(world.ownDirectory(), squatted);
    const Instance pretender([&](const auto& pause) {
        if (lockByte(open((squatted + "/a").c_str(), O_RDWR | O_CLOEXEC), 0)) pause();
    });
    EXPECT_EQ(busyOf(world.assertions, {"a"}), Names{"a"});
}

TEST(ProcessAssertionsOnLinux, NobodyWhoComesLaterIsMissedAmongOthersDirectories) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    LinuxAssertions world;
    chmod(world.scratch.path().c_str(), 0755);
    const std::string shared = busyDirectory(world.root);
    // In memory, where many changes take no time.
    if (mount("none", shared.c_str(), "tmpfs", 0, "mode=1777") != 0) GTEST_SKIP() << "may not mount";
    int mostChanges = 0; // that the kernel keeps
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> mostChanges;
    const std::tuple<const char*, std::function<void()>> cases[] = {
        {"none", [] {}},
        {"many",
         [&] {
             for (int change = 0; change <= mostChanges; ++change) {
                 const std::string path = shared + (change % 2 == 0 ? "/100000" : "/100001");
                 ASSERT_EQ(mkdir(path.c_str(), 0700), 0);
                 rmdir(path.c_str());
             }
         }},
        {"another directory around them", [&] { umount2(shared.c_str(), MNT_DETACH); }},
    };
    EXPECT_EQ(support::resultInChild([&] {
                  if (!support::becomeOrdinaryUser()) return 1;
                  for (int user = 200000; user < 200100; ++user)
                      if (mkdir((shared + '/' + std::to_string(user)).c_str(), 0700) != 0) return 2;
                  return 0;
              }),
              0);
    for (const auto& [change, make] : cases) {
        support::processLog.clear();
        platform::linux_::ProcessAssertions assertions(world.root);
        EXPECT_EQ(busyOf(assertions, {"a"}), Names()) << change;
        make();
        {
            const auto other = world.busy("a", true);
            EXPECT_EQ(busyOf(assertions, {"a"}), Names{"a"}) << change;
        }
        EXPECT_EQ(busyOf(assertions, {"a"}), Names()) << change;
        std::filesystem::remove_all(shared + '/' + std::to_string(support::ordinaryUser));
        const auto lines = support::processLog.lines();
        EXPECT_EQ(std::ranges::count(lines, platform::LogLevel::error, &support::FakeSystemLog::Line::level), 1)
            << "that there are such directories";
    }
}

TEST(ProcessAssertionsOnLinux, TellsAProcessOnceHoweverManyLocksItHolds) {
    LinuxAssertions world;
    const Instance greedy([&](const auto& pause) {
        const BusyAssertion assertion(world.root, identifier);
        const int file = open((world.ownDirectory() + "/" + identifier).c_str(), O_RDWR | O_CLOEXEC);
        for (off_t byte = 0; byte < 2000; byte += 2) {
            if (!lockByte(file, byte)) return;
        }
        pause();
    });
    const auto found = world.assertions.busyExtensionInstances({identifier});
    ASSERT_EQ(found.size(), 1U);
    EXPECT_EQ(found[0], (platform::Dictionary{{platform::instanceBundleIdentifierKey, identifier},
                                              {platform::linux_::instanceUserKey, geteuid()},
                                              {platform::linux_::instanceProcessKey, greedy.pid()}}));
}

} // namespace
