#include "platform/linux/ServiceLaunch.h"
#include "platform/linux/BusyAssertion.h"
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

#include <array>
#include <climits>
#include <future>
#include <linux/sched.h>
#include <poll.h>
#include <seccomp.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/syscall.h>

namespace fs = std::filesystem;
using namespace platform;
using linux_::LaunchStatus;

namespace {

constexpr const char* identifier = "com.example.plug-in";
constexpr const char* containerIdentifier = "com.example.plug-in.own"; // the plug-in's, not its bundle's

Dictionary overlay(const Dictionary& variables = {}, const Value& profile = "plugin") {
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

/// A launcher: a child of this process. Its standard output is a pipe, its standard input another one.
class Launcher {
public:
    Launcher(
        const linux_::Root& root, const std::string& name, const std::vector<std::string>& arguments,
        const std::function<void()>& prepare = [] {}) {
        int input[2];
        int output[2];
        if (pipe2(input, O_CLOEXEC) != 0 || pipe2(output, O_CLOEXEC) != 0) return;
        _pid = fork();
        if (_pid == 0) {
            alarm(30); // to fail instead of hanging
            dup2(input[0], STDIN_FILENO);
            dup2(output[1], STDOUT_FILENO);
            prepare();
            const auto refusal = linux_::becomeService(root, name, arguments);
            (void)!write(STDOUT_FILENO, refusal.reason.data(), refusal.reason.size());
            _exit(static_cast<int>(refusal.status));
        }
        close(input[0]);
        close(output[1]);
        _input = linux_::Descriptor(input[1]);
        _output = linux_::Descriptor(output[0]);
    }
    ~Launcher() { end(); }
    Launcher(const Launcher&) = delete;
    Launcher& operator=(const Launcher&) = delete;

    std::string readLine() const {
        std::string line;
        for (char byte = 0; read(_output.get(), &byte, 1) == 1 && byte != '\n';) line += byte;
        return line;
    }
    std::string readAll() const {
        std::string text;
        for (char byte = 0; read(_output.get(), &byte, 1) == 1;) text += byte;
        return text;
    }
    /// The exit status, or minus the signal.
    int end() {
        if (_pid < 0) return _status;
        _input.reset();
        int status = 0;
        waitpid(_pid, &status, 0);
        _pid = -1;
        _status = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
        return _status;
    }

private:
    pid_t _pid = -1;
    int _status = 0;
    linux_::Descriptor _input;
    linux_::Descriptor _output;
};

/// This process is the host. The plug-in's program is a shell.
class ServiceLaunch : public testing::Test {
protected:
    ServiceLaunch() {
        chmod(_scratch.path().c_str(), 0755);
        makeBundle();
        startManager();
    }

    void makeBundle() const {
        fs::remove_all(bundle());
        support::writeManifest(bundle(),
                               Dictionary{{"VBBundleIdentifier", identifier},
                                          {"VBBundleExecutable", "Program"},
                                          {"VKExtension", Dictionary{{"VKExtensionIdentifier", containerIdentifier}}}});
        fs::copy_file(fs::canonical("/bin/sh"), program());
    }
    void startManager(const linux_::ServiceLimits& limits = {}) {
        _manager.reset();
        _manager = std::make_unique<linux_::ServiceManager>(_root, _files, std::chrono::hours(1), limits);
        const auto failure = _manager->startServing();
        EXPECT_FALSE(failure) << failure->text();
    }
    std::string bundle() const { return _scratch / "Bundle"; }
    std::string program() const { return bundle() + "/Program"; }
    std::string hosts() const { return _root.runtime() + "/ignitd/hosts"; }
    int add(const Dictionary& given = overlay(), pid_t host = getpid()) const {
        return _manager->addExternalServiceForHost(tokenOf(host), program(), given);
    }
    int remove() {
        std::promise<int> answer;
        _manager->removeExternalService(identifier, "1", _queue, [&](int result) { answer.set_value(result); });
        return answer.get_future().get();
    }
    /// The exit status of a launch that runs `script`.
    int launch(const std::string& script = "", const std::string& name = identifier) const {
        return Launcher(_root, name, {"-c", script}).end();
    }
    static int status(LaunchStatus value) { return static_cast<int>(value); }

    support::ScratchDirectory _scratch;
    linux_::Root _root{_scratch.path()};
    linux_::Files _files{_root};
    linux_::WorkQueues _queues;
    std::shared_ptr<WorkQueue> _queue = _queues.makeSerial("killer", QualityOfService::standard);
    std::unique_ptr<linux_::ServiceManager> _manager;
};

} // namespace

TEST_F(ServiceLaunch, GivesWhatWasRegisteredAndNothingElse) {
    const auto container = linux_::Containers(_root).userContainer(containerIdentifier);
    ASSERT_TRUE(container);
    ASSERT_EQ(add(overlay({{"HOME", *container},
                           {"MESSAGE", "two words"},
                           {"PATH", "/nowhere"},
                           {"LD_PRELOAD", "/evil.so"},
                           {"GLIBC_TUNABLES", "glibc.malloc.check=3"},
                           {"NORDANE_ROOT", "/evil"}})),
              0);
    const std::string script = "export -p; echo \"$0 $1\"; pwd; [ -d tmp ] && [ -r /proc/self/fd/77 ] && echo leaked;"
                               "while read -r key value; do case $key in CapEff:|SigBlk:|SigIgn:|NoNewPrivs:|Seccomp:)"
                               "echo $key $value;; esac; done < /proc/self/status";
    Launcher launcher(_root, program(), {"-c", script, "name", "argument"}, [&] {
        clearenv();
        setenv("NORDANE_ROOT", _scratch.path().c_str(), 1);
        setenv("PATH", "/bin", 1);
        setenv("LANG", "C", 1);
        setenv("SECRET", "the host's", 1);
        // By the kernel's own calls, so that the two signals which the C library keeps to itself are among them.
        const std::array<std::uint64_t, 8> ignored{1}; // SIG_IGN
        const std::uint64_t all = ~std::uint64_t{0};
        for (const int number : {SIGTERM, 32, 33}) {
            syscall(SYS_rt_sigaction, number, ignored.data(), nullptr, sizeof all);
        }
        syscall(SYS_rt_sigprocmask, SIG_SETMASK, &all, nullptr, sizeof all);
        dup2(STDOUT_FILENO, 77);
    });
    const std::string zeros = "0000000000000000";
    EXPECT_EQ(launcher.readAll(), "export HOME='" + *container + "'\nexport LANG='C'\nexport MESSAGE='two words'\n" +
                                      "export NORDANE_ROOT='" + _scratch.path() + "'\nexport PATH='/nowhere'\n" +
                                      "export PWD='" + *container + "'\nname argument\n" + *container + "\n" +
                                      "SigBlk: " + zeros + "\nSigIgn: " + zeros + "\nCapEff: " + zeros +
                                      "\nNoNewPrivs: 1\nSeccomp: 2\n");
    EXPECT_EQ(launcher.end(), 0);
    EXPECT_EQ(launch("exit 7"), 7);
}

TEST_F(ServiceLaunch, LetsAServiceCountAsBusyAndNoOther) {
    ASSERT_EQ(add(), 0);
    const std::string busy = linux_::busyDirectory(_root) + "/" + std::to_string(geteuid()) + "/";
    EXPECT_EQ(launch("true < " + busy + identifier), 0);
    if (linux_::landlockVersion() == 0) GTEST_SKIP() << "this kernel has no Landlock";
    std::ofstream(busy + "com.example.other").flush();
    EXPECT_NE(launch("true < " + busy + "com.example.other"), 0);
    EXPECT_NE(launch("true >> " + busy + "com.example.new"), 0);
    EXPECT_NE(launch("true >> " + busy + identifier), 0) << "everybody's memory would fill";
    EXPECT_EQ(launch("[ \"$(echo " + busy + "*)\" = '" + busy + "*' ]"), 0) << "who else ran is not shown";
    EXPECT_EQ(support::resultInChild([&] {
                  const linux_::Descriptor file(open((busy + identifier).c_str(), O_PATH | O_CLOEXEC));
                  const linux_::OwnPlace own[] = {{file.get(), linux_::readFiles}};
                  if (linux_::confine(*linux_::findConfinementProfile("plugin"), own)) return 1;
                  return linux_::BusyAssertion(_root, identifier).failure() ? 2 : 0;
              }),
              0);
}

TEST_F(ServiceLaunch, IsForTheHostsOwnChildrenAlone) {
    EXPECT_EQ(launch(), status(LaunchStatus::notRegistered));
    ASSERT_EQ(add(), 0);
    EXPECT_EQ(launch(), 0);
    EXPECT_EQ(launch("", program()), 0);
    EXPECT_EQ(launch("", bundle() + "/../Bundle/Program"), 0);
    for (const std::string& name : {std::string("com.example.other"), std::string("/bin/sh"), program() + "x"})
        EXPECT_EQ(launch("", name), status(LaunchStatus::notRegistered)) << name;
    EXPECT_EQ(launch("", std::string(PATH_MAX, 'x')), status(LaunchStatus::usage));
    // Another process gets nothing of what this one was granted, not even a child of it.
    EXPECT_EQ(support::resultInChild([&] { return launch(); }), status(LaunchStatus::notRegistered));
    // Nor does who takes over the connection of a process that might ask.
    EXPECT_EQ(support::resultInChild([&] {
                  const auto connection = linux_::connectToRequestSocket(_root, linux_::launchSocketAddress);
                  return support::resultInChild([&] {
                      linux_::Descriptor registration;
                      return linux_::exchangeRequest(connection->get(), identifier, registration);
                  });
              }),
              ESRCH);
    _manager.reset();
    EXPECT_EQ(launch(), status(LaunchStatus::noManager));
}

TEST_F(ServiceLaunch, RefusesWhatWasReplacedSince) {
    const std::pair<const char*, std::function<void()>> changes[] = {
        {"another program took its place",
         [&] {
             fs::copy_file(program(), program() + ".new");
             fs::rename(program() + ".new", program());
         }},
        {"the program was written to", [&] { std::ofstream(program(), std::ios::app) << "x"; }},
        {"the program became a link",
         [&] {
             fs::rename(program(), _scratch / "Program");
             fs::create_symlink(_scratch / "Program", program());
         }},
        {"another bundle took its place, with the same program",
         [&] {
             fs::rename(bundle(), bundle() + ".old");
             fs::create_directory(bundle());
             fs::rename(bundle() + ".old/Program", program());
             fs::remove_all(bundle() + ".old");
         }},
    };
    for (const auto& [what, change] : changes) {
        makeBundle();
        ASSERT_EQ(add(), 0);
        EXPECT_EQ(launch(), 0);
        change();
        EXPECT_EQ(launch(), status(LaunchStatus::refused)) << what;
    }
}

TEST_F(ServiceLaunch, RegistersOnlyBundlesExecutablesForProcesses) {
    EXPECT_EQ(add(overlay(), 0x7fffffff), ESRCH);
    EXPECT_EQ(add(overlay(), 0), ESRCH);
    EXPECT_EQ(add(overlay({{"LONG", std::string(linux_::maximumRegistrationSize, 'x')}})), E2BIG);
    Value nested = 1;
    for (std::size_t depth = 0; depth + 3 < maximumNesting; ++depth) nested = Array{nested};
    for (const Value& unreadable : {Value(UUID::random()), nested})
        EXPECT_EQ(add(overlay({{"A", unreadable}})), EINVAL);
    const auto addProgram = [&](const std::string& path) {
        return _manager->addExternalServiceForHost(tokenOf(getpid()), path, overlay());
    };
    EXPECT_EQ(addProgram(bundle() + "/Info.vlist"), EINVAL);
    for (const std::string inner : {"Inner", "1/2/3/4/Inner"}) {
        // Its program would get the container of whoever the inner bundle says it is.
        support::writeManifest(
            bundle(), Dictionary{{"VBBundleIdentifier", identifier}, {"VBBundleExecutable", inner + "/Program"}});
        support::writeManifest(bundle() + '/' + inner, Dictionary{{"VBBundleIdentifier", "com.example.victim"},
                                                                  {"VBBundleExecutable", "Program"}});
        fs::copy_file(program(), bundle() + '/' + inner + "/Program");
        EXPECT_EQ(addProgram(bundle() + '/' + inner + "/Program"), EINVAL) << inner;
    }
    makeBundle();
    fs::remove(program());
    EXPECT_EQ(add(), EINVAL);
    fs::create_symlink(fs::canonical("/bin/sh"), program());
    EXPECT_EQ(add(), EINVAL) << "a link out of the bundle";
    makeBundle();
    support::writeManifest(bundle(), Dictionary{{"VBBundleIdentifier", "a@b"}, {"VBBundleExecutable", "Program"}});
    EXPECT_EQ(add(), EINVAL);
    makeBundle();
    EXPECT_EQ(add(), 0);
    for (const auto& [directory, open, closed] :
         {std::tuple("/ignitd", 0777U, 0755U), {"/ignitd/hosts", 0755U, 0700U}}) {
        startManager();
        ASSERT_EQ(chmod((_root.runtime() + directory).c_str(), open), 0);
        EXPECT_EQ(add({}, getppid()), EACCES) << directory;
        ASSERT_EQ(chmod((_root.runtime() + directory).c_str(), closed), 0);
    }
}

TEST_F(ServiceLaunch, BoundsWhatAUserMayHaveKept) {
    startManager({8192, 8192, 1, 1});
    const std::string page(4096, 'x');
    EXPECT_EQ(add(overlay({{"A", page}})), 0);
    EXPECT_EQ(add(overlay({{"A", page + page}})), EDQUOT);
    EXPECT_EQ(add(overlay({{"A", page}})), 0) << "in its own place";
    EXPECT_EQ(remove(), serviceHasNoInstances);
    EXPECT_EQ(add(overlay({{"A", page}})), 0) << "what was removed does not count";
    const support::WaitingProgram other("/bin/cat");
    EXPECT_EQ(add(overlay(), other.pid()), EDQUOT) << "a second host";
    {
        Launcher running(_root, identifier, {"-c", "echo up; read line"});
        ASSERT_EQ(running.readLine(), "up");
        EXPECT_EQ(launch(), status(LaunchStatus::refused)) << "a second instance";
        EXPECT_EQ(remove(), serviceInstancesTerminated);
    }
    startManager({8192, 4096, 2, 1});
    EXPECT_EQ(add(), 0);
    EXPECT_EQ(add(overlay(), other.pid()), EDQUOT) << "beyond the user's bytes";

    // Who is shorter of room than the one before takes nothing away from hosts that live.
    startManager({8192, 8192, 0, 1});
    EXPECT_EQ(launch(), status(LaunchStatus::notRegistered));
    startManager();
    EXPECT_EQ(launch(), 0);
}

TEST_F(ServiceLaunch, ARecycledPidInheritsNothing) {
    support::WaitingProgram host("/bin/cat");
    const pid_t pid = host.pid();
    const AuditToken token = tokenOf(pid);
    const auto identity = *linux_::ProcessIdentity::of(pid);
    linux_::ProcessWatch watch; // nobody takes what it tells, as in the moment of the host's end
    linux_::ServiceRegistrations registrations(_scratch / "hosts", watch);
    ASSERT_EQ(registrations.add(identity, 0, *linux_::registrationOf(_files, program(), overlay())), 0);
    ASSERT_TRUE(registrations.find(identity, identifier));
    // Start times count in ticks: one must have passed.
    while (linux_::ProcessIdentity::of(support::WaitingProgram("/bin/cat").pid())->startTime == identity.startTime) {
    }
    host.end();
    if (startAs(pid) != pid) GTEST_SKIP() << "this process may not choose the pid of another one";
    EXPECT_EQ(_manager->addExternalServiceForHost(token, program(), overlay()), ESRCH);
    const auto recycled = *linux_::ProcessIdentity::of(pid);
    EXPECT_FALSE(registrations.find(recycled, identifier));
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
}

TEST_F(ServiceLaunch, RemovalEndsInstancesAndRegistrations) {
    ASSERT_EQ(add(), 0);
    Launcher running(_root, identifier, {"-c", "echo up; read line"});
    ASSERT_EQ(running.readLine(), "up");
    EXPECT_EQ(remove(), serviceInstancesTerminated);
    EXPECT_EQ(running.end(), -SIGTERM);
    EXPECT_EQ(launch(), status(LaunchStatus::notRegistered));
    ASSERT_EQ(add(), 0);
    EXPECT_EQ(launch(), 0);
}

TEST_F(ServiceLaunch, RegistrationsOutliveTheManagerButNotTheirHost) {
    const linux_::Descriptor watch(inotify_init1(IN_CLOEXEC));
    ASSERT_EQ(add(), 0);
    ASSERT_GE(inotify_add_watch(watch.get(), hosts().c_str(), IN_DELETE), 0);
    {
        const support::WaitingProgram host("/bin/cat");
        ASSERT_EQ(add(overlay(), host.pid()), 0);
        EXPECT_EQ(entriesOf(hosts()), 2U);
    }
    pollfd deleted{watch.get(), POLLIN, 0};
    EXPECT_EQ(poll(&deleted, 1, 30000), 1) << "the registration outlived its host";
    EXPECT_EQ(entriesOf(hosts()), 1U);

    // What a process with a recycled pid would find, and what crashes leave: files that are none, and one replaced.
    const std::string own = fs::directory_iterator(hosts())->path();
    const std::string file = own + "/1";
    fs::copy(own, hosts() + "/" + std::to_string(getppid()) + "-1", fs::copy_options::recursive);
    for (const char* name : {"/0", "/98", "/97", "/x"}) fs::copy_file(file, own + name);
    std::ofstream(own + "/99") << "vlist16\n";
    _manager.reset();
    startManager();
    EXPECT_EQ(entriesOf(hosts()), 1U);
    EXPECT_EQ(entriesOf(own), 2U) << "the registration and the user";
    EXPECT_EQ(launch(), 0);
    ASSERT_EQ(add(), 0);
    EXPECT_EQ(entriesOf(own), 2U) << "replaced";
}

TEST_F(ServiceLaunch, ARestartChargesThoseWhoWereCharged) {
    // As a host that shows another user by now.
    const uid_t user = geteuid() + 1;
    const support::WaitingProgram host("/bin/cat");
    const support::WaitingProgram other("/bin/cat");
    const auto identity = *linux_::ProcessIdentity::of(host.pid());
    const auto otherIdentity = *linux_::ProcessIdentity::of(other.pid());
    const auto registration = *linux_::registrationOf(_files, program(), overlay());
    const std::string directory = _scratch / "hosts";
    linux_::ProcessWatch watch;
    ASSERT_EQ(linux_::ServiceRegistrations(directory, watch).add(identity, user, registration), 0);
    linux_::ServiceLimits limits;
    limits.hostsOfUser = 1;
    linux_::ServiceRegistrations restarted(directory, watch, limits);
    ASSERT_EQ(restarted.load(), 0);
    EXPECT_TRUE(restarted.find(identity, identifier));
    EXPECT_EQ(restarted.add(otherIdentity, user, registration), EDQUOT);
    EXPECT_EQ(restarted.add(otherIdentity, geteuid(), registration), 0);

    // What a crash left of an instance that never started counts for nobody.
    ASSERT_EQ(add(), 0);
    const std::string instance = _root.runtime() + "/ignitd/" + identifier + "@1/" + otherIdentity.name();
    fs::create_directories(fs::path(instance).parent_path());
    std::ofstream{instance};
    limits.instancesOfUser = 1;
    startManager(limits);
    EXPECT_EQ(launch(), 0);
}

TEST_F(ServiceLaunch, TenThousandRegistrationsEndWithTheirHost) {
    linux_::ProcessWatch watch;
    const support::ScratchDirectory memory(fs::exists("/dev/shm") ? "/dev/shm" : "/tmp"); // as /run is
    linux_::ServiceRegistrations registrations(memory / "hosts", watch);
    auto registration = *linux_::registrationOf(_files, program(), overlay());
    std::string directory;
    {
        const support::WaitingProgram host("/bin/cat");
        directory = memory / "hosts/" + linux_::ProcessIdentity::of(host.pid())->name();
        for (int number = 0; number < 10000; ++number) {
            registration.executablePath = program() + std::to_string(number);
            ASSERT_EQ(registrations.add(*linux_::ProcessIdentity::of(host.pid()), 0, registration), 0);
        }
        EXPECT_EQ(entriesOf(directory), 10001U) << "and one for the user";
        EXPECT_TRUE(watch.takeEnded().empty());
    }
    pollfd ended{watch.descriptor(), POLLIN, 0};
    ASSERT_EQ(poll(&ended, 1, 30000), 1);
    EXPECT_EQ(watch.takeEnded(), std::vector{directory});
    EXPECT_TRUE(registrations.end(directory));
    EXPECT_FALSE(fs::exists(directory));
    EXPECT_TRUE(watch.takeEnded().empty()) << "one descriptor for all";

    for (int number = 0; number < 10000; ++number) ASSERT_EQ(add(), 0);
    EXPECT_EQ(entriesOf(fs::directory_iterator(hosts())->path()), 2U) << "each takes the place of the one before";
}

TEST_F(ServiceLaunch, ServicesOfAnotherUserLiveInThatUsersContainer) {
    if (geteuid() != 0) GTEST_SKIP() << "only root's manager serves other users";
    const auto managers = linux_::Containers(_root).userContainer(containerIdentifier);
    ASSERT_TRUE(managers);
    int registered[2];
    ASSERT_EQ(pipe2(registered, O_CLOEXEC), 0);
    const pid_t host = fork();
    if (host == 0) {
        alarm(30);
        char byte = 0;
        if (!support::becomeOrdinaryUser() || read(registered[0], &byte, 1) != 1) _exit(1);
        Launcher launcher(_root, identifier, {"-c", "echo $TMPDIR; echo > tmp/file && pwd"});
        const std::string own =
            _root.users() + '/' + std::to_string(support::ordinaryUser) + "/Containers/" + containerIdentifier;
        const std::string output = launcher.readAll();
        _exit(output == own + "/tmp\n" + own + "\n" && launcher.end() == 0 ? 0 : 2);
    }
    EXPECT_EQ(add(overlay({{"TMPDIR", *managers + "/tmp"}}), host), 0);
    EXPECT_EQ(write(registered[1], "x", 1), 1);
    int result = -1;
    waitpid(host, &result, 0);
    EXPECT_EQ(result, 0);
    close(registered[0]);
    close(registered[1]);
}

TEST_F(ServiceLaunch, ServicesLaunchNothing) {
    ASSERT_EQ(add(), 0);
    EXPECT_EQ(support::resultInChild([&] {
                  // Version 0: it is the filter that keeps them from it, Landlock knows nothing of sockets.
                  if (linux_::confine(*linux_::findConfinementProfile("plugin"), {}, 0)) return 1;
                  const auto connection = linux_::connectToRequestSocket(_root, linux_::launchSocketAddress);
                  return connection || connection.error().code != EACCES ? 2 : 0;
              }),
              0);
}

TEST_F(ServiceLaunch, WithoutLandlockStartsOnlyWhenToldTo) {
    ASSERT_EQ(add(), 0);
    const auto launchOnOldKernel = [&](const char* allowed) {
        Launcher launcher(_root, identifier, {"-c", "exit 7"}, [&] {
            scmp_filter_ctx filter = seccomp_init(SCMP_ACT_ALLOW);
            if (seccomp_rule_add(filter, SCMP_ACT_ERRNO(ENOSYS), SCMP_SYS(landlock_create_ruleset), 0) != 0 ||
                seccomp_load(filter) != 0)
                _exit(1);
            unsetenv(linux_::allowUnconfinedVariable);
            if (allowed != nullptr) setenv(linux_::allowUnconfinedVariable, allowed, 1);
        });
        return launcher.end();
    };
    EXPECT_EQ(launchOnOldKernel(nullptr), status(LaunchStatus::notConfined));
    EXPECT_EQ(launchOnOldKernel("1"), 7);
}

TEST(ServiceDescription, SaysWhatIsWrongWithAnOverlay) {
    const auto with = [](const char* key, const Value& value) {
        auto service = MutableDictionary::copyOf(*overlay().dictionary("QMXService"));
        service.set(key, value);
        return Dictionary{{"VBBundlePackageType", "QMX!"}, {"QMXService", service}};
    };
    const auto environment = [&](const char* name, const Value& value) {
        return with("EnvironmentVariables", Dictionary{{name, value}});
    };
    const std::pair<Dictionary, const char*> cases[] = {
        {{}, "the overlay has no \"QMXService\" dictionary"},
        {{{"QMXService", Dictionary()}}, "the overlay is not of package type \"QMX!\""},
        {with("_SandboxProfile", 7), "\"_SandboxProfile\" is no string"},
        {with("_SandboxProfile", "none"), "there is no sandbox profile \"none\""},
        {with("EnvironmentVariables", Array{"A=1"}), "\"EnvironmentVariables\" is no dictionary"},
        {environment("NUMBER", 7), "the environment variable \"NUMBER\" is no string"},
        {environment("LD_PRELOAD", true), "the environment variable \"LD_PRELOAD\" is no string"},
        {environment("A=B", "c"), "no environment variable can be named \"A=B\""},
        {environment("", "c"), "no environment variable can be named \"\""},
    };
    for (const auto& [given, text] : cases) {
        const auto read = linux_::readServiceDescription(given);
        ASSERT_TRUE(std::holds_alternative<std::string>(read)) << text;
        EXPECT_EQ(std::get<std::string>(read), text);
    }
    const auto read = linux_::readServiceDescription(environment("LD_LIBRARY_PATH", "/evil"));
    ASSERT_TRUE(std::holds_alternative<linux_::ServiceDescription>(read));
    EXPECT_EQ(std::get<linux_::ServiceDescription>(read).dropped, std::vector<std::string>{"LD_LIBRARY_PATH"});
}
