#include "platform/linux/ServiceLaunch.h"
#include "platform/linux/Containers.h"
#include "platform/linux/Files.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/ProcessAssertions.h"
#include "platform/linux/ServiceEnvironment.h"
#include "platform/linux/ServiceManager.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <future>
#include <linux/sched.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/syscall.h>

namespace fs = std::filesystem;
using namespace platform;
using linux_::LaunchStatus;

namespace {

constexpr const char* identifier = "com.example.plug-in";
constexpr const char* containerIdentifier = "com.example.plug-in.own"; // the plug-in's, not its bundle's

Dictionary overlay(const Value& variables = Dictionary(), const Value& profile = "plugin") {
    return {{"VBBundlePackageType", "QMX!"},
            {"QMXService", Dictionary{{"EnvironmentVariables", variables}, {"_SandboxProfile", profile}}}};
}

AuditToken tokenOf(pid_t pid) { return {pid, geteuid(), getegid(), linux_::LinuxPeerProcess::look(pid)}; }

/// A child with that very pid, which waits for a signal; -1 when this process may not choose.
pid_t startAs(pid_t pid) {
    clone_args arguments{};
    arguments.exit_signal = SIGCHLD;
    arguments.set_tid = reinterpret_cast<std::uintptr_t>(&pid);
    arguments.set_tid_size = 1;
    const auto child = static_cast<pid_t>(syscall(SYS_clone3, &arguments, sizeof arguments));
    if (child == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        for (;;) pause();
    }
    return child;
}

std::size_t entriesOf(const std::string& directory) {
    return static_cast<std::size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
}

/// This process is the host. The plug-in's program is a shell.
class ServiceLaunch : public testing::Test {
protected:
    ServiceLaunch() {
        chmod(_scratch.path().c_str(), 0755);
        makeBundle();
        startManager();
    }

    static void writeManifest(const std::string& path, const char* name, const char* executable = "Code/Program") {
        const Dictionary extension{{"VKExtensionIdentifier", containerIdentifier}};
        support::writeManifest(
            path,
            Dictionary{{"VBBundleIdentifier", name}, {"VBBundleExecutable", executable}, {"VKExtension", extension}});
    }
    void makeBundle() const {
        fs::remove_all(bundle());
        writeManifest(bundle(), identifier);
        fs::create_directory(bundle() + "/Code");
        fs::copy_file(fs::canonical("/bin/sh"), program());
    }
    void startManager(const linux_::ServiceLimits& limits = {},
                      std::chrono::milliseconds grace = std::chrono::hours(1)) {
        _manager.reset();
        _manager = std::make_unique<linux_::ServiceManager>(_root, _files, grace, limits);
        EXPECT_FALSE(_manager->startServing());
    }
    std::string bundle() const { return _scratch / "Bundle"; }
    std::string program() const { return bundle() + "/Code/Program"; }
    std::string kept(const std::string& name) const { return _root.runtime() + "/ignitd/" + name; }
    std::string instances(const std::string& version = "1") const { return kept(identifier + ("@" + version)); }
    int add(const Dictionary& given = overlay(), pid_t host = getpid(), const std::string& path = "") const {
        return _manager->addExternalServiceForHost(tokenOf(host), path.empty() ? program() : path, given);
    }
    auto registration() { return *linux_::registrationOf(_files, program(), overlay()); }
    static auto identityOf(const support::WaitingProgram& process) {
        return *linux_::ProcessIdentity::of(process.pid());
    }
    /// The answer, which must come on the queue and once.
    std::future<int> removal(const std::string& name = identifier, const std::string& version = "1") {
        auto answer = std::make_shared<std::promise<int>>(); // a second answer throws
        _manager->removeExternalService(name, version, _queue, [this, answer](int result) {
            _queue->assertCurrent();
            answer->set_value(result);
        });
        return answer->get_future();
    }
    int remove() { return removal().get(); }
    /// As an earlier daemon left it.
    void record(const std::string& process, uid_t user = geteuid(), const std::string& version = "1") const {
        support::writeFile(instances(version) + '/' + process, std::to_string(user));
    }
    auto startInstance(const support::Preparation& prepare = support::atOnce, const std::string& version = "1") const {
        auto instance = std::make_unique<support::WaitingProgram>("/bin/cat", prepare);
        record(identityOf(*instance).name(), geteuid(), version);
        return instance;
    }
    support::ChildProgram start(const std::string& path, const std::vector<std::string>& arguments,
                                const support::Preparation& prepare = support::atOnce) const {
        return support::ChildProgram(path, prepare, arguments, _environment);
    }
    /// The exit status of a launch that runs `script`.
    int launch(const std::string& script = "", const std::string& name = identifier) const {
        return start(ZBIGNITE, {name, "-c", script}).finish();
    }
    static int status(LaunchStatus value) { return static_cast<int>(value); }

    support::ScratchDirectory _scratch;
    // The leak checker cannot look into a confined process.
    std::vector<std::string> _environment{"NORDANE_ROOT=" + _scratch.path(), "PATH=/bin", "LANG=C", "SECRET=the host's",
                                          "ASAN_OPTIONS=detect_leaks=0"};
    linux_::Root _root{_scratch.path()};
    linux_::Files _files{_root};
    linux_::WorkQueues _queues;
    std::shared_ptr<WorkQueue> _queue = _queues.makeSerial("killer", QualityOfService::standard);
    std::unique_ptr<linux_::ServiceManager> _manager;
    // What the manager keeps its registrations with, for another host.
    support::WaitingProgram _host{"/bin/cat"};
    linux_::ProcessWatch _watch;
    linux_::ServiceRegistrations _registrations{_scratch / "hosts", _watch};
};

using ServiceRemoval = ServiceLaunch;

/// For an instance that does not end when it is asked to.
bool ignoreTermination() { return signal(SIGTERM, SIG_IGN) != SIG_ERR; }

} // namespace

TEST_F(ServiceLaunch, GivesWhatWasRegisteredAndNothingElse) {
    const std::string container = *linux_::Containers(_root).userContainer(containerIdentifier);
    ASSERT_EQ(add(overlay(Dictionary{{"HOME", container},
                                     {"MESSAGE", "two words"},
                                     {"PATH", "/nowhere"},
                                     {"LD_PRELOAD", "/evil.so"},
                                     {"GLIBC_TUNABLES", "glibc.malloc.check=3"},
                                     {"NORDANE_ROOT", "/evil"}})),
              0);
    const std::string script = "export -p; echo \"$0 $1\"; pwd; [ -d tmp ] && [ -r /proc/self/fd/77 ] && echo leaked;"
                               "while read -r key value; do case $key in CapEff:|SigBlk:|SigIgn:|NoNewPrivs:|Seccomp:)"
                               "echo $key $value;; esac; done < /proc/self/status; exit 7";
    auto launcher = start(ZBIGNITE, {program(), "-c", script, "name", "argument"}, [] {
        // By the kernel's own calls, so that the two signals which the C library keeps to itself are among them.
        const std::uint64_t all = ~std::uint64_t{0};
        const std::uint64_t ignored[8] = {1}; // SIG_IGN
        for (const int number : {32, 33}) syscall(SYS_rt_sigaction, number, ignored, nullptr, sizeof all);
        syscall(SYS_rt_sigprocmask, SIG_SETMASK, &all, nullptr, sizeof all);
        return ignoreTermination() && dup2(STDOUT_FILENO, 77) == 77;
    });
    const std::string zeros = "0000000000000000";
    EXPECT_EQ(launcher.readTo(), "export HOME='" + container + "'\nexport LANG='C'\nexport MESSAGE='two words'\n" +
                                     "export NORDANE_ROOT='" + _scratch.path() + "'\nexport PATH='/nowhere'\n" +
                                     "export PWD='" + container + "'\nname argument\n" + container + "\n" +
                                     "SigBlk: " + zeros + "\nSigIgn: " + zeros + "\nCapEff: " + zeros +
                                     "\nNoNewPrivs: 1\nSeccomp: 2\n");
    EXPECT_EQ(launcher.finish(), 7);
}

TEST_F(ServiceLaunch, LetsAServiceCountAsBusyAndNoOther) {
    ASSERT_EQ(add(), 0);
    const std::string busy = linux_::busyDirectory(_root) + "/" + std::to_string(geteuid()) + "/";
    EXPECT_EQ(launch("true < " + busy + identifier), 0);
    if (linux_::landlockVersion() == 0) GTEST_SKIP() << "this kernel has no Landlock";
    // The second would fill everybody's memory, the last one shows who else ran.
    for (const auto& script : {"true >> " + busy + "com.example.new", "true >> " + busy + identifier,
                               "[ \"$(echo " + busy + "*)\" != '" + busy + "*' ]"})
        EXPECT_NE(launch(script), 0) << script;
}

TEST_F(ServiceLaunch, IsForTheHostsOwnChildrenAlone) {
    EXPECT_EQ(launch(), status(LaunchStatus::notRegistered));
    ASSERT_EQ(add(), 0);
    for (const std::string& name : {std::string(identifier), program(), bundle() + "/../Bundle/Code/Program"})
        EXPECT_EQ(launch("", name), 0) << name;
    for (const char* name : {"com.example.other", "/bin/sh"})
        EXPECT_EQ(launch("", name), status(LaunchStatus::notRegistered)) << name;
    // Another process gets nothing of what this one was granted, not even a child of it.
    EXPECT_EQ(start("/bin/sh", {"-c", "\"$@\"; exit $?", "sh", ZBIGNITE, identifier}).finish(),
              status(LaunchStatus::notRegistered));
    // Nor does who takes over the connection of a process that might ask.
    const auto connection = linux_::connectToRequestSocket(_root, linux_::launchSocketAddress);
    const int number = support::resultInChild([&] {
        linux_::Descriptor granted;
        return linux_::exchangeRequest(connection->get(), identifier, granted);
    });
    EXPECT_EQ(number, ESRCH);
}

TEST_F(ServiceLaunch, RefusesWhatWasReplacedSince) {
    const std::pair<const char*, const char*> changes[] = {
        {"another program took its place", "cp Code/Program ../old && mv ../old Code/Program"},
        {"the program was written to", "echo >> Code/Program"},
        {"the program became a link", "mv Code/Program ../old && ln -s ../../old Code/Program"},
        {"another bundle has the same program", "cd .. && mv Bundle old2 && mkdir Bundle && mv old2/Code Bundle"},
    };
    for (const auto& [what, change] : changes) {
        makeBundle();
        ASSERT_EQ(add(), 0);
        ASSERT_EQ(std::system(("cd " + bundle() + " && " + change).c_str()), 0);
        EXPECT_EQ(launch(), status(LaunchStatus::refused)) << what;
    }
}

TEST_F(ServiceLaunch, RegistersOnlyBundlesExecutablesForProcesses) {
    EXPECT_EQ(add(overlay(), 0x7fffffff), ESRCH);
    EXPECT_EQ(add(overlay(Dictionary{{"LONG", std::string(linux_::maximumRegistrationSize, 'x')}})), E2BIG);
    EXPECT_EQ(add(overlay(Dictionary{{"A", UUID::random()}})), EINVAL) << "what no launch could read";
    // Its program would get the container of whoever the inner bundle says it is.
    const std::string inner = bundle() + "/1/2/3/4/Inner";
    writeManifest(bundle(), identifier, "1/2/3/4/Inner/Program");
    writeManifest(inner, "com.example.victim", "Program");
    fs::copy_file(program(), inner + "/Program");
    EXPECT_EQ(add(overlay(), getpid(), inner + "/Program"), EINVAL);
    makeBundle();
    fs::remove(program());
    fs::create_symlink(fs::canonical("/bin/sh"), program());
    EXPECT_EQ(add(), EINVAL) << "a link out of the bundle";
    makeBundle();
    EXPECT_EQ(add(), 0);
    for (const auto& [directory, open, closed] : {std::tuple("ignitd", 0777U, 0755U), {"ignitd/hosts", 0755U, 0700U}}) {
        const std::string path = _root.runtime() + '/' + directory;
        ASSERT_EQ(chmod(path.c_str(), open), 0);
        EXPECT_EQ(add({}, getppid()), EACCES) << directory;
        ASSERT_EQ(chmod(path.c_str(), closed), 0);
    }
}

TEST_F(ServiceLaunch, BoundsWhatAUserMayHaveKept) {
    startManager({8192, 8192, 1, 1});
    const std::string page(4096, 'x');
    const auto large = overlay(Dictionary{{"A", page}});
    for (const char* time : {"first", "in its own place"}) EXPECT_EQ(add(large), 0) << time;
    EXPECT_EQ(add(overlay(Dictionary{{"A", page + page}})), EDQUOT);
    EXPECT_EQ(remove(), serviceHasNoInstances);
    EXPECT_EQ(launch(), status(LaunchStatus::notRegistered)) << "removed";
    EXPECT_EQ(add(large), 0) << "what was removed does not count";
    EXPECT_EQ(add(overlay(), _host.pid()), EDQUOT) << "a second host";
    auto running = start(ZBIGNITE, {identifier, "-c", "echo up; read line"});
    ASSERT_EQ(running.readTo('\n'), "up");
    EXPECT_EQ(launch(), status(LaunchStatus::refused)) << "a second instance";
    EXPECT_EQ(remove(), serviceInstancesTerminated);
    EXPECT_EQ(running.finish(), -SIGTERM);
}

TEST_F(ServiceLaunch, ARecycledPidInheritsNothing) {
    const pid_t pid = _host.pid();
    const AuditToken token = tokenOf(pid);
    const auto identity = identityOf(_host);
    ASSERT_EQ(_registrations.add(identity, 0, registration()), 0);
    ASSERT_TRUE(_registrations.find(identity, identifier));
    // Start times count in ticks: one must have passed.
    while (identityOf(support::WaitingProgram("/bin/cat")).startTime == identity.startTime) {
    }
    _host.end(); // and nobody takes what the watch tells, as in that very moment
    if (startAs(pid) != pid) GTEST_SKIP() << "this process may not choose the pid of another one";
    EXPECT_EQ(_manager->addExternalServiceForHost(token, program(), overlay()), ESRCH);
    EXPECT_FALSE(_registrations.find(*linux_::ProcessIdentity::of(pid), identifier));
    kill(pid, SIGKILL);
    support::waitFor(pid);
}

TEST_F(ServiceLaunch, RegistrationsOutliveTheManagerButNotTheirHost) {
    ASSERT_EQ(add(), 0);
    const linux_::Descriptor watch(inotify_init1(IN_CLOEXEC));
    ASSERT_GE(inotify_add_watch(watch.get(), kept("hosts").c_str(), IN_DELETE), 0);
    ASSERT_EQ(add(overlay(), _host.pid()), 0);
    _host.end();
    pollfd deleted{watch.get(), POLLIN, 0};
    EXPECT_EQ(poll(&deleted, 1, 30000), 1) << "the registration outlived its host";

    // What a process with a recycled pid would find, and what a crash leaves.
    const std::string own = fs::directory_iterator(kept("hosts"))->path();
    fs::copy(own, kept("hosts") + "/" + std::to_string(getppid()) + "-1", fs::copy_options::recursive);
    std::ofstream(own + "/99") << "vlist16\n";
    startManager();
    EXPECT_EQ(entriesOf(kept("hosts")), 1U);
    EXPECT_EQ(entriesOf(own), 2U) << "the registration and the user";
    EXPECT_EQ(launch(), 0);
}

TEST_F(ServiceRemoval, AnswersAfterTheInstancesOfThatVersionEnded) {
    const auto first = startInstance();
    const auto second = startInstance();
    const auto other = startInstance(support::atOnce, "2");
    EXPECT_EQ(remove(), serviceInstancesTerminated);
    for (const auto& instance : {first.get(), second.get()}) {
        EXPECT_TRUE(instance->hasEnded());
        EXPECT_EQ(instance->finish(), -SIGTERM);
    }
    EXPECT_FALSE(other->hasEnded());
    EXPECT_FALSE(fs::exists(instances())) << "nothing is left of the service";
    EXPECT_EQ(remove(), serviceHasNoInstances);
}

TEST_F(ServiceRemoval, KillsWhatLivesOnAfterTheGracePeriod) {
    startManager({}, std::chrono::milliseconds(20));
    const auto instance = startInstance(ignoreTermination);
    EXPECT_EQ(remove(), serviceInstancesTerminated);
    EXPECT_EQ(instance->finish(), -SIGKILL);
}

TEST_F(ServiceRemoval, NeverSignalsWhatIsNoInstanceAnyMore) {
    const support::WaitingProgram innocent("/bin/cat");
    const std::string recycled = std::to_string(innocent.pid()) + "-1";
    record(recycled);
    // As one that runs a set-user-id program by now.
    record(identityOf(innocent).name(), geteuid() + 1);
    EXPECT_EQ(remove(), serviceHasNoInstances);
    EXPECT_FALSE(fs::exists(instances() + '/' + recycled)) << "stale";
    EXPECT_FALSE(innocent.hasEnded());
}

TEST_F(ServiceRemoval, DoesNotBelieveOpenDirectories) {
    const auto instance = startInstance();
    for (const std::string& open : {instances(), kept("")}) {
        ASSERT_EQ(chmod(open.c_str(), 0777), 0);
        EXPECT_EQ(remove(), EACCES);
        ASSERT_EQ(chmod(open.c_str(), 0755), 0);
    }
    fs::rename(instances(), instances("2"));
    fs::create_directory_symlink(instances("2"), instances());
    EXPECT_EQ(remove(), ENOTDIR);
    EXPECT_FALSE(instance->hasEnded());
}

TEST_F(ServiceRemoval, RefusesNamesThatAreNoNames) {
    for (const std::string name : {"", "..", "a/../b", "a@b"}) EXPECT_EQ(removal(name).get(), EINVAL) << name;
    EXPECT_EQ(removal(identifier, "../1").get(), EINVAL);
    EXPECT_EQ(removal(identifier, "1 @ beta").get(), serviceHasNoInstances);
}

TEST_F(ServiceLaunch, TenThousandRegistrationsEndWithTheirHost) {
    const auto identity = identityOf(_host);
    const std::string directory = _scratch / "hosts/" + identity.name();
    auto numbered = registration();
    for (int number = 0; number < 10000; ++number) {
        numbered.executablePath = program() + std::to_string(number);
        ASSERT_EQ(_registrations.add(identity, 0, numbered), 0);
    }
    EXPECT_EQ(entriesOf(directory), 10001U) << "and one for the user";
    _host.end();
    pollfd ended{_watch.descriptor(), POLLIN, 0};
    ASSERT_EQ(poll(&ended, 1, 30000), 1);
    EXPECT_EQ(_watch.takeEnded(), std::vector{directory}) << "once for all";
    EXPECT_TRUE(_registrations.end(directory));
    EXPECT_FALSE(fs::exists(directory));
}

TEST_F(ServiceLaunch, ServicesOfAnotherUserLiveInThatUsersContainer) {
    if (geteuid() != 0) GTEST_SKIP() << "only root's manager serves other users";
    const std::string managers = *linux_::Containers(_root).userContainer(containerIdentifier);
    const std::string launcher = _scratch / "zbignite"; // the build's may be closed to others
    fs::copy_file(ZBIGNITE, launcher);
    auto host = start(
        "/bin/sh",
        {"-c", "read line; \"$@\"; exit $?", "sh", launcher, identifier, "-c", "echo $TMPDIR; echo > tmp/file && pwd"},
        support::becomeOrdinaryUser);
    EXPECT_EQ(add(overlay(Dictionary{{"TMPDIR", managers + "/tmp"}}), host.pid()), 0);
    EXPECT_EQ(host.finish(), 0);
    const std::string own =
        _root.users() + '/' + std::to_string(support::ordinaryUser) + "/Containers/" + containerIdentifier;
    EXPECT_EQ(host.readTo(), own + "/tmp\n" + own + "\n");
}

TEST_F(ServiceLaunch, WithoutLandlockStartsOnlyWhenToldTo) {
    ASSERT_EQ(add(), 0);
    const auto becomeOld = [] { return support::loseSystemCall(SYS_landlock_create_ruleset); };
    EXPECT_EQ(start(ZBIGNITE, {identifier}, becomeOld).finish(), status(LaunchStatus::notConfined));
    _environment.push_back(std::string(linux_::allowUnconfinedVariable) + "=1");
    EXPECT_EQ(start(ZBIGNITE, {identifier, "-c", "exit 7"}, becomeOld).finish(), 7);
}

TEST(ServiceDescription, SaysWhatIsWrongWithAnOverlay) {
    const auto named = [](const char* name, const Value& value) { return overlay(Dictionary{{name, value}}); };
    const std::pair<Dictionary, const char*> cases[] = {
        {{}, "the overlay has no \"QMXService\" dictionary"},
        {{{"QMXService", Dictionary()}}, "the overlay is not of package type \"QMX!\""},
        {overlay(Dictionary(), 7), "\"_SandboxProfile\" is no string"},
        {overlay(Dictionary(), "none"), "there is no sandbox profile \"none\""},
        {overlay(Array{"A=1"}), "\"EnvironmentVariables\" is no dictionary"},
        {named("LD_PRELOAD", true), "the environment variable \"LD_PRELOAD\" is no string"},
        {named("A=B", "c"), "no environment variable can be named \"A=B\""},
    };
    for (const auto& [given, text] : cases)
        EXPECT_EQ(std::get<std::string>(linux_::readServiceDescription(given)), text);
}
